#pragma once
// A private temporary directory, removed with everything in it at the end.

#include <string>

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

}  // namespace qmtest
