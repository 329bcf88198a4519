#include "LoadRun.h"

#include <algorithm>
#include <atomic>
#include <thread>
#include <vector>

#include "RoundTripClient.h"

namespace {

using Clock = std::chrono::steady_clock;

constexpr int kWarmUpRoundTrips = 200;

double percentileMicros(std::vector<std::uint32_t>& nanos, double fraction) {
    if (nanos.empty()) {
        return 0;
    }
    auto index = static_cast<std::size_t>(fraction * static_cast<double>(nanos.size() - 1));
    std::nth_element(nanos.begin(), nanos.begin() + static_cast<long>(index), nanos.end());
    return nanos[index] / 1000.0;
}

}  // namespace

LoadResult runLoad(const std::string& socketPath, const qm::Bytes& requestFrame, int clients,
                   std::chrono::milliseconds duration) {
    std::atomic<int> ready{0};
    std::atomic<bool> go{false};
    std::atomic<bool> stop{false};
    std::atomic<bool> failed{false};
    std::vector<std::vector<std::uint32_t>> latencies(static_cast<std::size_t>(clients));
    std::vector<std::thread> threads;
    for (int c = 0; c < clients; ++c) {
        threads.emplace_back([&, c] {
            auto client = RoundTripClient::connect(socketPath);
            qm::Bytes frame = requestFrame;
            bool usable = client.has_value();
            for (int i = 0; usable && i < kWarmUpRoundTrips; ++i) {
                usable = client->roundTrip(frame) != nullptr;
            }
            if (!usable) {
                failed = true;
            }
            ++ready;
            while (!go.load()) {
                std::this_thread::yield();
            }
            auto& mine = latencies[static_cast<std::size_t>(c)];
            mine.reserve(1 << 20);
            while (usable && !stop.load(std::memory_order_relaxed)) {
                auto start = Clock::now();
                if (!client->roundTrip(frame)) {
                    failed = true;
                    return;
                }
                auto nanos = std::chrono::duration_cast<std::chrono::nanoseconds>(Clock::now() - start).count();
                mine.push_back(static_cast<std::uint32_t>(std::min<long long>(nanos, UINT32_MAX)));
            }
        });
    }
    while (ready.load() < clients) {
        std::this_thread::sleep_for(std::chrono::milliseconds(1));
    }
    auto start = Clock::now();
    go = true;
    std::this_thread::sleep_for(duration);
    stop = true;
    for (auto& t : threads) {
        t.join();
    }
    double seconds = std::chrono::duration<double>(Clock::now() - start).count();

    LoadResult result;
    result.ok = !failed.load();
    std::vector<std::uint32_t> all;
    for (auto& mine : latencies) {
        all.insert(all.end(), mine.begin(), mine.end());
    }
    result.roundTrips = all.size();
    result.roundTripsPerSecond = static_cast<double>(all.size()) / seconds;
    result.p50Micros = percentileMicros(all, 0.50);
    result.p99Micros = percentileMicros(all, 0.99);
    return result;
}
