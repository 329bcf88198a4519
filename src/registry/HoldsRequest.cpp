#include "registry/HoldsRequest.h"

#include <chrono>

#include "model/QMError.h"
#include "registry/HoldList.h"

Reply listHolds(RequestContext& context) {
    if (context.client.sandboxed) {
        return Reply::fail(kQMErrorDenied, "unauthorized request");
    }
    qm::Array holds;
    for (const auto& hold : context.holds.holds()) {
        qm::Array plugIns;
        for (const qm::Uuid& plugIn : hold->blocked()) {
            plugIns.emplace_back(plugIn);
        }
        auto created = std::chrono::duration<double>(hold->created().time_since_epoch()).count();
        qm::Dictionary entry{{"uuid", qm::Value(hold->uuid())},
                             {"pid", qm::Value(static_cast<std::int64_t>(hold->holderPid()))},
                             {"created", qm::Value(qm::Date{created})},
                             {"plugins", qm::Value(std::move(plugIns))}};
        if (hold->holderExecutable()) {
            entry.set("executable", qm::Value(*hold->holderExecutable()));
        }
        holds.emplace_back(std::move(entry));
    }
    return Reply::success(qm::Dictionary{{"holds", qm::Value(std::move(holds))}});
}
