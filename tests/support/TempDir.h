#pragma once
// A private temporary directory, removed with everything in it at the end.

#include <string>

#include "platform/plist/PropertyList.h"

namespace qmtest {

class TempDir {
public:
    TempDir();
    ~TempDir();
    TempDir(const TempDir&) = delete;
    TempDir& operator=(const TempDir&) = delete;

    const std::string& path() const { return path_; }
    std::string file(const std::string& name) const { return path_ + "/" + name; }

private:
    std::string path_;
};

// Writes text to a file (creating parent directories); asserts on failure.
void writeFile(const std::string& path, const std::string& text);
std::string readFile(const std::string& path);
// Writes a property list, replacing the file by rename (creating parent
// directories); a failure is a test failure.
void writePlist(const std::string& path, const qm::Value& value, qm::plist::Format format = qm::plist::Format::xml);

}  // namespace qmtest
