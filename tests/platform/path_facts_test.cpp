// Path facts: canonical paths, modification times and the "lies under" test.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include "platform/file/PathFacts.h"
#include "support/TempDir.h"

namespace {

TEST(PathFacts, LyingUnderARootIsDecidedAtComponentBoundaries) {
    EXPECT_TRUE(qm::isPathWithin("/a/b/c", "/a/b"));
    EXPECT_TRUE(qm::isPathWithin("/a/b", "/a/b"));
    EXPECT_TRUE(qm::isPathWithin("/a/b/c", "/a/b/"));
    EXPECT_TRUE(qm::isPathWithin("/a", "/"));
    EXPECT_FALSE(qm::isPathWithin("/a/bc", "/a/b"));
    EXPECT_FALSE(qm::isPathWithin("/a", "/a/b"));
    EXPECT_FALSE(qm::isPathWithin("/a/b", ""));
}

TEST(PathFacts, ResolvedPathsFollowLinksAndDots) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("real/file"), "x");
    ASSERT_EQ(::symlink(dir.file("real").c_str(), dir.file("link").c_str()), 0);
    auto real = qm::resolvedPath(dir.file("real/file"));
    ASSERT_TRUE(real.ok());
    auto viaLink = qm::resolvedPath(dir.file("link/../real/./file"));
    ASSERT_TRUE(viaLink.ok());
    EXPECT_EQ(*viaLink, *real);
    auto missing = qm::resolvedPath(dir.file("missing"));
    ASSERT_FALSE(missing.ok());
    EXPECT_EQ(missing.error().code, ENOENT);
}

TEST(PathFacts, TheModificationTimeIsTheFilesMtime) {
    qmtest::TempDir dir;
    qmtest::writeFile(dir.file("f"), "x");
    struct timespec times[2] = {{0, UTIME_OMIT}, {1234567890, 0}};
    ASSERT_EQ(::utimensat(AT_FDCWD, dir.file("f").c_str(), times, 0), 0);
    auto mtime = qm::modificationTime(dir.file("f"));
    ASSERT_TRUE(mtime.ok());
    EXPECT_EQ(*mtime, 1234567890);
    EXPECT_FALSE(qm::modificationTime(dir.file("missing")).ok());
}

}  // namespace
