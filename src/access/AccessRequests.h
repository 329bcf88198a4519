#pragma once
// What a host needs to use a plug-in it discovered: "access" answers read
// tokens for the plug-ins' bundles (any client, any registered plug-in);
// "ready" checks holds and the host checks, then registers each plug-in's
// executable as a service the host may launch, with an environment in the
// plug-in's data container and a sandbox profile chosen for it.

#include <set>
#include <string>

#include "registry/QMDPlugIn.h"
#include "registry/Request.h"

Reply readyPlugIns(RequestContext& context);
Reply accessPlugIns(RequestContext& context);

// `enableForPid:`: registers the plug-in's service for the host process.
qm::MaybeError enableForPid(const QMDPlugIn& plugIn, pid_t host);
// `allowedPVCServices`: the consent services granted to the plug-in's
// containing application; failures are log lines and grant nothing.
std::set<std::string> allowedPVCServices(const QMDPlugIn& plugIn);
