#pragma once
// Following the daemon's change notifications from qmkit, for commands that
// stay connected (hold, watch).
//
// The daemon posts "ovaro.quamber.annotation-change" for every annotation
// change and every hold taken or released, and "ovaro.quamber.plugins-change"
// once it has taken in plug-ins installed or uninstalled. Posts coalesce, so
// a command asks the daemon what the state is after each one rather than
// counting them.

#include <functional>
#include <optional>
#include <set>
#include <string>

#include "DaemonSession.h"
#include "platform/queue/EventLoop.h"

// Asked with the names that landed (empty for the first look, made once
// watching has begun, so no change goes unseen); an exit status ends the
// watch.
using ChangeLook = std::function<std::optional<int>(const std::set<std::string>& changed)>;

// Runs `loop` until `look` returns an exit status, SIGINT or SIGTERM arrives
// (0), the session's connection is lost or the notifications can no longer
// be watched (3, with a message on standard error prefixed by `command`).
// The session must have made its connection, and the termination signals
// must have been blocked before any thread started
// (qm::blockTerminationSignals), so they reach only the loop.
int followChanges(DaemonSession& session, qm::EventLoop& loop, const std::string& command, const ChangeLook& look);
