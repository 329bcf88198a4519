// Property lists as the catalog reads them from bundles: XML or binary, told
// apart by the reader, through the structure checks into a Value.
//
// Checked beyond "no crash": whatever was read and can be written again
// (in either format) reads back.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <span>

#include "platform/plist/PropertyList.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto value = qm::plist::parse(std::span<const std::uint8_t>(data, size));
    if (!value) {
        return 0;
    }
    for (auto format : {qm::plist::Format::binary, qm::plist::Format::xml}) {
        auto written = qm::plist::serialize(*value, format);
        if (written && !qm::plist::parse(*written)) {
            std::abort();
        }
    }
    return 0;
}
