#pragma once
// Errors of the daemon's own domain, "Quamber": what clients see in replies
// and what the model reports about plug-ins.

#include <optional>
#include <string>

#include "platform/error/Error.h"
#include "platform/text/Format.h"

inline constexpr const char* kQuamberErrorDomain = "Quamber";

// An error of the "Quamber" domain; the description is its localized description.
qm::Error QMError(int code, std::optional<std::string> description);

template <class... Args>
qm::Error QMErrorWithFormat(int code, std::string_view format, const Args&... args) {
    return QMError(code, qm::format(format, args...));
}

// Error codes of the "Quamber" domain.
enum QMErrorCode : int {
    kQMErrorRegistration = 2,      // AppCatalog refused, or "add" failed
    kQMErrorInvalidRequest = 4,    // malformed or unknown request, transport failure
    kQMErrorVersion = 7,           // protocol or database version
    kQMErrorPath = 9,              // a path that is relative, missing or unregistered
    kQMErrorDenied = 11,           // the client may not do this
    kQMErrorPlugInUnusable = 12,   // a plug-in that cannot be used
    kQMErrorBusy = 14,             // plug-ins are busy
};
