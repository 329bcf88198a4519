// The documented wire format, spoken by a client that shares no code with
// ours: Python's cbor2 and a struct-packed frame header.

#include <gtest/gtest.h>

#include "support/DaemonProcess.h"

TEST(WireFormat, AnIndependentPythonClientIsServed) {
    qmtest::DaemonProcess daemon;
    auto result = qmtest::runProgram(
        {QM_SYSTEM_PYTHON, std::string(QM_SOURCE_DIR) + "/tests/daemon/wire_client.py", daemon.socketPath()});
    EXPECT_EQ(result.exitStatus, 0) << result.out << result.err;
    EXPECT_EQ(result.out, "");
}
