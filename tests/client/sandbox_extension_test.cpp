// The holder of a received token: one consumption at a time, ended by
// expel or teardown.

#include <gtest/gtest.h>

#include "client/QMSandboxExtension.h"
#include "platform/sandbox/ExtensionConsumption.h"
#include "platform/sandbox/ReadExtensions.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

TEST(SandboxExtension, AHolderConsumesOnceAndReleasesOnce) {
    qmtest::TempDir dir;
    qmtest::ScopedEnvironment duct("QM_DUCT_DIR", dir.file("duct"));
    qmtest::writeFile(dir.file("resource"), "x");
    auto token = qm::issueReadExtension(dir.file("resource"));
    ASSERT_TRUE(token) << token.error().text();

    std::int64_t released = 0;
    {
        QMSandboxExtension holder(*token);
        holder.expel();  // idle: nothing to end
        EXPECT_EQ(holder.handle(), 0);
        holder.consume();
        std::int64_t first = holder.handle();
        EXPECT_GT(first, 0);
        holder.consume();
        EXPECT_EQ(holder.handle(), first) << "consumed once";
        holder.expel();
        EXPECT_FALSE(qm::releaseExtension(first)) << "expel released it already";
        holder.consume();
        released = holder.handle();
        EXPECT_NE(released, first);
    }
    EXPECT_FALSE(qm::releaseExtension(released)) << "teardown released it";

    QMSandboxExtension forged(*token + "0");
    forged.consume();
    EXPECT_EQ(forged.handle(), -1);
}

}  // namespace
