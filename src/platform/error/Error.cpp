#include "platform/error/Error.h"

#include <cstring>

namespace qm {

Error posixError(int errorNumber, std::string context) {
    std::string text = std::move(context);
    if (!text.empty()) {
        text += ": ";
    }
    text += std::strerror(errorNumber);
    return Error{kPosixErrorDomain, errorNumber, std::move(text)};
}

}  // namespace qm
