#pragma once
// Every environment variable the system reads is read here, and only here.
// Values are read at each call (tests change them between cases), except
// where a comment says they are read once.

#include <optional>
#include <string>
#include <vector>

#include "platform/error/Error.h"

namespace qm {

struct ProcessEnvironment {
    bool logToStderr = false;  // QM_LOG_STDERR=1; read once
};
const ProcessEnvironment& environment();

// The Duct runtime directory: $QM_DUCT_DIR, else $XDG_RUNTIME_DIR/ovaro,
// else /tmp/ovaro-<uid>.
std::string ductRuntimeDirectory();

// QM_IDLE_EXIT: seconds without clients, holds or work before the daemon
// exits; nothing when unset or empty; an error naming the variable for
// anything but a positive decimal number.
Result<std::optional<unsigned>> idleExitSeconds();

// Descriptors passed by systemd socket activation (LISTEN_FDS, for this
// process per LISTEN_PID). Clears the variables so children do not inherit them.
std::vector<int> takeSocketActivationDescriptors();

// QMTEST_SDK: the test SDK directory, when set.
std::optional<std::string> testSdkDirectory();

// SDK directories in lookup order: $QM_SDK_PATH (colon-separated), else
// $XDG_DATA_HOME/ovaro/SDKs then /usr/share/ovaro/SDKs.
std::vector<std::string> sdkSearchPath();

// QM_SYSTEM_ROOTS (colon-separated), empty entries dropped.
std::vector<std::string> systemRoots();

// XDG base directories with their defaults under $HOME.
std::string xdgDataHome();
std::string xdgConfigHome();
std::string xdgStateHome();

// $XDG_DATA_DIRS (colon-separated, empty entries dropped), else
// /usr/local/share then /usr/share; most important first.
std::vector<std::string> xdgDataDirectories();

// The catalog database: $QM_CATALOG_DB, else $XDG_DATA_HOME/ovaro/AppCatalog.db.
std::string catalogDatabasePath();

// The user's install root: $XDG_DATA_HOME/ovaro/Applications.
std::string userApplicationsRoot();

// The folder of plug-in data containers: $XDG_DATA_HOME/ovaro/Containers.
std::string dataContainersDirectory();

// The user's consent grants: $XDG_DATA_HOME/ovaro/Consent.plist.
std::string consentStorePath();

// The user's language: the first of LANGUAGE, LC_ALL, LC_MESSAGES, LANG that
// is set and not empty, cut before "_", "." or "@" (and before ":" for
// LANGUAGE lists); nothing when none is set.
std::optional<std::string> userLanguage();

}  // namespace qm
