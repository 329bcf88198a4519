#include "model/QMError.h"

qm::Error QMError(int code, std::optional<std::string> description) {
    return qm::Error{kQuamberErrorDomain, code, std::move(description)};
}
