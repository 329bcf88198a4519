#include "support/TempDir.h"

#include <gtest/gtest.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

namespace qmtest {

TempDir::TempDir() : path_((std::filesystem::temp_directory_path() / "qmtest-XXXXXX").string()) {
    EXPECT_NE(::mkdtemp(path_.data()), nullptr);
}

TempDir::~TempDir() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
}

void writeFile(const std::string& path, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    std::ofstream out(path, std::ios::binary | std::ios::trunc);
    out << text;
    EXPECT_TRUE(out.good()) << path;
}

void writePlist(const std::string& path, const qm::Value& value, qm::plist::Format format) {
    std::filesystem::create_directories(std::filesystem::path(path).parent_path());
    auto error = qm::plist::writeFileAtomically(path, value, format);
    EXPECT_FALSE(error) << path << ": " << error->text();
}

std::string readFile(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

}  // namespace qmtest
