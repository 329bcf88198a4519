#pragma once
// What a request handler gets and gives. Handlers are free functions in the
// folder of their subsystem (registry, discovery, access); they know nothing
// of sockets, queues or transactions. Each runs on mainQueue, one at a time,
// and answers exactly once: with its reply.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "platform/error/Error.h"
#include "platform/log/Logger.h"
#include "platform/value/Value.h"
#include "registry/ClientIdentity.h"
#include "registry/HoldOwner.h"

class HoldList;
class QMDatabase;
class QMDUserPrefs;  // discovery's; only discovery reads it

// A handler's answer: the result keys and, for a failure, its code and
// message (a failure may still carry result keys, as "lock" carries
// "conflicts"). The daemon writes "errorcode" and "error" from the failure.
struct Reply {
    struct Failure {
        int code = 0;
        std::optional<std::string> message;  // none: the reply has no "error"
    };
    qm::Dictionary values;
    std::optional<Failure> failure;

    static Reply success(qm::Dictionary values = {}) { return Reply{std::move(values), std::nullopt}; }
    static Reply fail(int code, std::optional<std::string> message) {
        return Reply{{}, Failure{code, std::move(message)}};
    }
    // An error of the daemon's own domain keeps its own code; any other
    // domain's takes the code given.
    static Reply fail(int code, const qm::Error& error);
};

// The daemon around one request.
struct RequestContext {
    QMDatabase& registry;
    HoldList& holds;
    QMDUserPrefs& userPrefs;
    const qm::Logger& logger;
    const ClientIdentity& client;
    // The client as a hold refers to it: weakly, and only to ask whether it
    // still accepts work.
    std::weak_ptr<const HoldOwner> holdOwner;
    const qm::Value& request;
    std::uint64_t version;  // 2 or 3: checked before any handler runs
};

using RequestHandler = Reply (*)(RequestContext& context);
