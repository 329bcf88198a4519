#pragma once
// One per-user preference domain: the property list (XML or binary)
// $XDG_CONFIG_HOME/ovaro/<domain>.plist, written by other software and only
// read here.
//
// Values are those of the last synchronize(). A missing file or folder means
// no preferences; so does a damaged one (unparsable, unreadable, or whose top
// is not a dictionary), which is logged once per state of the file.
//
// Not thread-safe: one object is used by one thread or serial queue at a
// time (the daemon's transaction queue).

#include <optional>
#include <string>
#include <string_view>

#include "platform/file/FileStamp.h"
#include "platform/value/Value.h"

namespace qm {

class PreferenceDomain {
public:
    // The current user's domain. The name is a file name chosen by code: not
    // empty, no "/", not starting with "." (asserted).
    static PreferenceDomain forUser(std::string_view domain);

    // A domain kept in the file at path.
    explicit PreferenceDomain(std::string path);

    const std::string& path() const noexcept { return path_; }

    // Brings the values up to date with the file: it is read again when its
    // (inode, size, mtime ns, ctime ns) changed since the last reading, or
    // when it was modified less than 2 s ago (two writes within one tick of
    // the file system's clock can leave that stamp alike). So a change
    // written before this call, in place or by rename, is seen after it.
    // Costs one stat when nothing changed. Returns true when it went to the
    // file's content again (whatever it found there), false when it kept the
    // values of an unchanged file or found no file.
    bool synchronize();

    // The value under key as of the last synchronize(); nothing before the
    // first one or when the key is absent.
    std::optional<Value> valueForKey(std::string_view key) const;

    // Every value as of the last synchronize().
    const Dictionary& values() const noexcept { return values_; }

private:
    void forgetValues(std::optional<FileStamp> stamp);
    void reportDamage(const FileStamp& stamp, const std::string& reason);

    std::string path_;
    Dictionary values_;
    std::optional<FileStamp> readStamp_;      // of the file state values_ came from
    std::optional<FileStamp> reportedStamp_;  // the damaged state last logged
    int reportedStatError_ = 0;                // the errno of the failed stat last logged
};

}  // namespace qm
