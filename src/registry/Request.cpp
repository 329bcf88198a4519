#include "registry/Request.h"

#include "model/QMError.h"

Reply Reply::fail(int code, const qm::Error& error) {
    if (error.domain == kQuamberErrorDomain) {
        return fail(static_cast<int>(error.code), error.description);
    }
    return fail(code, error.description);
}
