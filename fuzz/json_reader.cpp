// The JSON reader qmkit takes values typed on its command line with.
//
// Checked beyond "no crash": the text written for what was read reads back
// to a value written the same way.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>
#include <string_view>

#include "platform/value/Json.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    std::string_view text(reinterpret_cast<const char*>(data), size);
    auto value = qm::json::parse(text);
    if (!value) {
        return 0;
    }
    std::string written = qm::json::write(*value, false);
    auto again = qm::json::parse(written);
    if (!again || qm::json::write(*again, false) != written) {
        std::abort();
    }
    return 0;
}
