#include "discovery/QMDUserPrefs.h"

QMDUserPrefs::QMDUserPrefs() : domain_(qm::PreferenceDomain::forUser("ovaro.quamber.userprefs")) {}

std::optional<qm::Value> QMDUserPrefs::exclusions() {
    domain_.synchronize();
    return domain_.valueForKey("exclusions");
}
