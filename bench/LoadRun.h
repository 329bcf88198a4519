#pragma once
// Drives a server with N concurrent clients, each doing one round trip after
// another for a while, and measures throughput and latency.

#include <chrono>
#include <cstdint>
#include <string>

#include "platform/value/Value.h"

struct LoadResult {
    bool ok = false;
    std::uint64_t roundTrips = 0;
    double roundTripsPerSecond = 0;
    double p50Micros = 0;
    double p99Micros = 0;
};

// Clients start together after a short warm-up; client threads inherit the
// calling thread's CPU affinity.
LoadResult runLoad(const std::string& socketPath, const qm::Bytes& requestFrame, int clients,
                   std::chrono::milliseconds duration);
