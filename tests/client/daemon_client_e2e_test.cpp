// QMDaemonClient against a real qmd: one client shared by many threads gets
// every reply and refusal of the daemon. What each request sends, and what
// the library makes of every kind of reply, are the unit tests' business.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "client/QMDaemonClient.h"
#include "support/DaemonProcess.h"
#include "support/ScopedEnvironment.h"

namespace {

using namespace std::chrono_literals;

TEST(DaemonClientE2E, ManyThreadsShareOneClientAndGetTheDaemonsRepliesAndRefusals) {
    qmtest::DaemonProcess daemon;
    qmtest::ScopedEnvironment ductDirectory("QM_DUCT_DIR", daemon.runtimeDirectory());
    auto client = QMDaemonClient::initWithServiceName(daemon.serviceName().c_str(), 5000ms);
    ASSERT_TRUE(client.ok()) << client.error().text();
    std::atomic<int> good{0};
    {
        std::vector<std::jthread> threads;
        for (int t = 0; t < 4; ++t) {
            threads.emplace_back([&, t] {
                for (int i = 0; i < 25; ++i) {
                    auto message = (*client)->request((i + t) % 2 ? "bulk" : "x-unknown");
                    auto error = QMDaemonClient::errorInReply((*client)->sendAndWait(message, 10000ms));
                    std::string expected = (i + t) % 2 ? "" : "unrecognized request";
                    good += (error ? error->text() : "") == expected && (!error || error->domain == "Quamber") ? 1 : 0;
                }
            });
        }
    }
    EXPECT_EQ(good.load(), 100);
    EXPECT_TRUE(daemon.waitForLog("bulk options 0x0 not supported"));
}

}  // namespace
