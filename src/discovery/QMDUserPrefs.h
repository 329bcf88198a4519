#pragma once
// The user's preferences of the daemon, domain "ovaro.quamber.userprefs":
// only read here, written by other software. mainQueue only.

#include <optional>

#include "platform/prefs/PreferenceDomain.h"
#include "platform/value/Value.h"

class QMDUserPrefs {
public:
    QMDUserPrefs();

    // "exclusions": rules dictionaries; a plug-in that satisfies any of
    // them is withheld from every host. Re-read first when the file changed,
    // so a change written before a request is seen by that request.
    std::optional<qm::Value> exclusions();

private:
    qm::PreferenceDomain domain_;
};
