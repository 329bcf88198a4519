#include "registry/AnnotateRequest.h"

#include "model/QMError.h"
#include "model/ValueHelpers.h"
#include "protocol/WireKeys.h"
#include "registry/Probes.h"
#include "registry/QMDatabase.h"
#include "registry/RequestWalks.h"

Reply annotatePlugIns(RequestContext& context) {
    QM_PROBE_REQ_ANNOTATE();
    const qm::Dictionary* annotations = QMGetDuctDictionary(context.request, wire::kAnnotations);
    if (annotations == nullptr) {
        return Reply::fail(kQMErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    }
    qm::Dictionary annotation;
    if (const qm::Value* election = annotations->find("election")) {
        if (!election->isNumber() && !election->asBool()) {
            return Reply::fail(kQMErrorInvalidRequest, "invalid request format (annotation election)");
        }
        annotation.set("election", *election);
    }
    if (const qm::Value* extension = annotations->find("extension")) {
        if (!extension->isDictionary()) {
            return Reply::fail(kQMErrorInvalidRequest, "invalid request format (annotation extension)");
        }
        annotation.set("extension", *extension);
    }
    // Nothing to store: the plug-ins are not even looked up.
    if (annotation.empty()) {
        return Reply::success();
    }
    auto failure = processUuidList(context.request, context.registry, [&](const QMDPlugInPtr& plugIn) {
        context.registry.setAnnotationForPlugIn(annotation, *plugIn);
        return std::optional<Reply>();
    });
    return failure ? std::move(*failure) : Reply::success();
}
