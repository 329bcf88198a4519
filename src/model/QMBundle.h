#pragma once
// The few facts the daemon needs about a bundle on disk (an application, a
// plug-in, or the bundle around a client's executable): its path, its
// executable, its Info dictionary and identifier, and where its plug-ins lie.
//
// A copyable value over the platform's BundleDirectory; copies share the
// Info dictionary, read once. Paths stand where the design has URLs; url()
// gives the file URL of path(). Getters report nothing when a bundle lacks
// the fact. Safe to use from any thread.

#include <optional>
#include <string>

#include "platform/bundle/BundleDirectory.h"
#include "platform/value/Value.h"

class QMBundle {
public:
    // A bundle directory (flat or desktop style).
    static std::optional<QMBundle> initWithPath(const std::string& bundlePath);
    // The bundle around an executable; when the path is no executable inside
    // a bundle, the bundle directory at that path.
    static std::optional<QMBundle> initWithExecutablePath(const std::string& executablePath);
    // The bundle of the running process, when it runs from one.
    static std::optional<QMBundle> initForMainBundle();

    explicit QMBundle(qm::BundleDirectory directory);

    std::optional<std::string> path() const;
    std::string url() const;
    // The executable, else path() (a bundle without one, such as a data plug-in).
    std::optional<std::string> executablePath() const;
    std::optional<qm::Value> infoDictionary() const;
    // Info "MRBundleIdentifier" when it is a string.
    std::optional<std::string> bundleIdentifier() const;
    // path()/Contents when executablePath() contains "/Exec/" (desktop style), else path().
    std::optional<std::string> supportPath() const;
    // supportPath() with name appended as a path component.
    std::optional<std::string> bundleDirectory(const std::string& name) const;
    // bundleDirectory("PlugIns").
    std::optional<std::string> plugInsPath() const;

    const qm::BundleDirectory& directory() const { return directory_; }

private:
    qm::BundleDirectory directory_;
};
