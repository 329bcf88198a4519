#pragma once
// The platform's bundle object. A bundle is a directory in one of two
// layouts:
//   flat:          Foo.app/Info.plist, the executable beside it (Foo.app/Foo)
//   desktop style: Foo.app/Contents/Info.plist, the executable in
//                  Foo.app/Contents/Exec/
// The executable's file name is the Info key "MRBundleExecutable".
//
// A BundleDirectory is a cheap, copyable handle; copies share the Info
// dictionary, which is read once, on first use, and then kept for the life
// of the handle (a bundle on disk is treated as unchanging while it is in
// use). All members may be called from any thread.

#include <memory>
#include <optional>
#include <string>

#include "platform/value/Value.h"

namespace qm {

class BundleDirectory {
public:
    // A bundle directory: it must be a directory holding Info.plist (flat,
    // looked for first) or Contents/Info.plist (desktop style); else nothing.
    // A relative path is taken from the current directory.
    static std::optional<BundleDirectory> atPath(const std::string& bundlePath);

    // The bundle around an executable (an existing file that is not a
    // directory): the executable's folder when it holds Info.plist (flat), or
    // the folder above Contents/ when the executable lies in Contents/Exec/
    // beside Contents/Info.plist (desktop style); else nothing.
    static std::optional<BundleDirectory> aroundExecutable(const std::string& executablePath);

    // The bundle around this process's executable (/proc/self/exe), if any.
    static std::optional<BundleDirectory> ofRunningProcess();

    // The bundle directory: absolute, as given (not resolved), no trailing slash.
    const std::string& path() const;

    // The executable named by "MRBundleExecutable" (whether or not it exists);
    // nothing when the Info dictionary names none or names something that is
    // not a plain file name.
    std::optional<std::string> executablePath() const;

    // The folder holding Info.plist: path() or path()/Contents.
    const std::string& infoFolder() const;
    std::string infoPlistPath() const;
    bool isDesktopStyle() const;

    // The Info dictionary plus "MRBundleInfoPlistURL" (the file URL of the
    // Info file); nothing, and one log line, when the file is unreadable or
    // not a dictionary.
    std::optional<qm::Value> infoDictionary() const;

private:
    struct State;
    explicit BundleDirectory(std::shared_ptr<State> state);

    std::shared_ptr<State> state_;
};

// "file://" followed by the path with every byte but the unreserved
// characters of RFC 3986 (letters, digits, "-._~") and "/" percent-encoded.
std::string fileURL(const std::string& absolutePath);

}  // namespace qm
