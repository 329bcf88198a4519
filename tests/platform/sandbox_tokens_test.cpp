// Sandbox extension tokens: issuing, verifying and consuming them, and the
// key file that signs them.

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <thread>
#include <tuple>
#include <vector>

#include "platform/file/FolderEntries.h"
#include "platform/file/PathFacts.h"
#include "platform/sandbox/ExtensionConsumption.h"
#include "platform/sandbox/ReadExtensions.h"
#include "support/ScopedEnvironment.h"
#include "support/TempDir.h"

namespace {

class SandboxTokens : public ::testing::Test {
protected:
    qmtest::TempDir runtime;  // D, holding the key
    qmtest::TempDir files;
    qmtest::ScopedEnvironment duct{"QM_DUCT_DIR", runtime.path()};
    std::string keyPath = runtime.file("token.key");

    std::string file(const std::string& name) const { return *qm::resolvedPath(files.path()) + "/" + name; }
};

std::string lowerHex(const std::string& bytes) {
    std::string hex;
    for (unsigned char c : bytes) {
        hex += "0123456789abcdef"[c >> 4];
        hex += "0123456789abcdef"[c & 15];
    }
    return hex;
}

TEST_F(SandboxTokens, GenuineTokensVerifyAndNameTheCanonicalPath) {
    qmtest::writeFile(file("dir/file"), "x");
    qmtest::writeFile(file("odd ;\xC3\xA9 name"), "x");
    ASSERT_EQ(::symlink(file("dir").c_str(), file("link").c_str()), 0);
    // {asked, canonical}: how links and dots resolve is PathFacts' to show; that they do is shown here.
    const std::pair<std::string, std::string> cases[] = {{file("dir/file"), file("dir/file")}, {file("link"), file("dir")},
                                                         {file("odd ;\xC3\xA9 name"), file("odd ;\xC3\xA9 name")}};
    for (const auto& [asked, canonical] : cases) {
        auto token = qm::issueReadExtension(asked);
        ASSERT_TRUE(token.ok()) << asked << ": " << token.error().text();
        std::string prefix = "qm1;read;" + lowerHex(canonical) + ";";
        EXPECT_EQ(token->substr(0, prefix.size()), prefix);
        EXPECT_EQ(token->find_first_not_of("0123456789abcdef", prefix.size()), std::string::npos);
        EXPECT_EQ(token->size(), prefix.size() + 64);
        auto grant = qm::verifyExtension(*token);
        ASSERT_TRUE(grant.ok()) << grant.error().text();
        EXPECT_EQ(*grant, (qm::TokenGrant{"read", canonical}));
    }
}

TEST_F(SandboxTokens, AnyChangeToAGenuineTokenMakesItWorthless) {
    qmtest::writeFile(file("f"), "x");
    std::string token = *qm::issueReadExtension(file("f"));
    std::string upperSignature = token;
    for (std::size_t i = token.rfind(';'); i < token.size(); ++i) {
        upperSignature[i] = static_cast<char>(std::toupper(static_cast<unsigned char>(token[i])));
    }
    std::vector<std::string> forgeries = {upperSignature, token.substr(0, token.size() - 1), token + "0", "",
                                          "qm1;read;;", std::string(token.size(), ';')};
    for (std::size_t i = 0; i < token.size(); ++i) {
        forgeries.push_back(token);
        forgeries.back()[i] = token[i] == 'a' ? 'b' : 'a';
    }
    {
        qmtest::TempDir otherRuntime;
        qmtest::ScopedEnvironment otherDuct("QM_DUCT_DIR", otherRuntime.path());
        forgeries.push_back(*qm::issueReadExtension(file("f")));  // signed with another key
    }
    for (const std::string& forgery : forgeries) {
        auto grant = qm::verifyExtension(forgery);
        ASSERT_NE(forgery, token);
        ASSERT_FALSE(grant.ok()) << forgery;
        EXPECT_EQ(grant.error().code, EINVAL);
        EXPECT_EQ(qm::consumeExtension(forgery), -1) << forgery;
    }
}

// Resolution failures keep their errno; a path whose canonical form leaves
// its container gets EACCES.
TEST_F(SandboxTokens, NoTokenForAPathThatDoesNotResolveOrLeavesItsContainer) {
    qmtest::writeFile(file("Ext.xbun/Resources/a"), "x");
    qmtest::writeFile(file("Ext.xbun2/b"), "x");
    qmtest::writeFile(file("outside/secret"), "x");
    ASSERT_EQ(::symlink("../outside", file("Ext.xbun/escape").c_str()), 0);
    ASSERT_EQ(::symlink("Resources", file("Ext.xbun/inner").c_str()), 0);
    ASSERT_EQ(::symlink(file("Ext.xbun").c_str(), file("ExtLink").c_str()), 0);
    ASSERT_EQ(::symlink(file("loop").c_str(), file("loop").c_str()), 0);
    // {path, container, errno (0: granted)}
    const std::tuple<std::string, std::optional<std::string>, int> cases[] = {
        {file("missing"), std::nullopt, ENOENT},
        {file("Ext.xbun/Resources/a/below"), std::nullopt, ENOTDIR},
        {file("loop"), std::nullopt, ELOOP},
        {file("Ext.xbun"), file("Ext.xbun"), 0},
        {file("Ext.xbun/inner/a"), file("Ext.xbun"), 0},
        {file("ExtLink/Resources/a"), file("ExtLink/Resources/.."), 0},
        {file("Ext.xbun/../outside/secret"), file("Ext.xbun"), EACCES},
        {file("Ext.xbun/escape/secret"), file("Ext.xbun"), EACCES},
        {file("Ext.xbun2/b"), file("Ext.xbun"), EACCES},  // a sibling sharing the name's start
    };
    for (const auto& [path, container, errorNumber] : cases) {
        auto token = qm::issueReadExtension(path, container);
        EXPECT_EQ(token.ok() ? 0 : token.error().code, errorNumber) << path << " in " << container.value_or("");
    }
}

TEST_F(SandboxTokens, RacingCreatorsShareOnePrivateKey) {
    for (int round = 0; round < 20; ++round) {
        qmtest::TempDir dir;
        std::string path = dir.file("D/token.key");
        std::vector<qm::TokenKeyCache> caches(4);
        std::vector<qm::TokenKeyBytes> keys(caches.size());
        std::atomic<bool> go{false};
        std::vector<std::thread> creators;
        for (std::size_t i = 0; i < caches.size(); ++i) {
            creators.emplace_back([&, i] {
                while (!go) {
                }
                auto key = caches[i].key(path, qm::TokenKeyCreation::createWhenMissing);
                EXPECT_TRUE(key.ok());
                keys[i] = key ? *key : qm::TokenKeyBytes{};
            });
        }
        go = true;
        for (auto& creator : creators) {
            creator.join();
        }
        EXPECT_EQ(std::count(keys.begin(), keys.end(), keys[0]), 4);
        struct stat key {}, folder {};
        ASSERT_EQ(::stat(path.c_str(), &key) | ::stat(dir.file("D").c_str(), &folder), 0);
        EXPECT_EQ(key.st_mode & 07777, 0600u);
        EXPECT_EQ(key.st_size, 32);
        EXPECT_EQ(folder.st_mode & 07777, 0700u);
        EXPECT_EQ(*qm::folderEntryNames(dir.file("D")), std::vector<std::string>{"token.key"}) << "temporaries left";
    }
}

TEST_F(SandboxTokens, VerifiersNeverCreateAKeyAndFollowAReplacedOne) {
    qmtest::writeFile(file("f"), "x");
    auto none = qm::verifyExtension("qm1;read;2f;" + std::string(64, '0'));
    EXPECT_EQ(none.ok() ? 0 : none.error().code, ENOENT);
    EXPECT_NE(::access(keyPath.c_str(), F_OK), 0);

    std::string first = *qm::issueReadExtension(file("f"));
    ASSERT_EQ(::unlink(keyPath.c_str()), 0);
    qm::TokenKeyCache anotherProcess;
    auto replaced = anotherProcess.key(keyPath, qm::TokenKeyCreation::createWhenMissing);
    ASSERT_TRUE(replaced.ok());
    EXPECT_FALSE(qm::verifyExtension(first).ok()) << "the old key is still in use";
    std::string second = qm::signToken({"read", file("f")}, *replaced);
    EXPECT_TRUE(qm::verifyExtension(second).ok());

    ASSERT_EQ(::chmod(keyPath.c_str(), 0640), 0);
    auto exposed = qm::verifyExtension(second);
    EXPECT_EQ(exposed.ok() ? 0 : exposed.error().code, EACCES);
    ASSERT_EQ(::unlink(keyPath.c_str()), 0);
    qmtest::writeFile(keyPath, std::string(31, 'k'));
    ASSERT_EQ(::chmod(keyPath.c_str(), 0600), 0);
    auto shortKey = qm::issueReadExtension(file("f"));
    EXPECT_EQ(shortKey.ok() ? 0 : shortKey.error().code, EINVAL);
}

TEST_F(SandboxTokens, ConsumedTokensGiveHandlesUntilReleased) {
    qmtest::writeFile(file("f"), "x");
    std::string token = *qm::issueReadExtension(file("f"));
    std::int64_t first = qm::consumeExtension(token);
    std::int64_t second = qm::consumeExtension(token);
    EXPECT_GE(first, 1);
    EXPECT_EQ(second, first + 1);
    EXPECT_TRUE(qm::releaseExtension(first));
    EXPECT_TRUE(qm::releaseExtension(second));
    for (std::int64_t never : {first, std::int64_t{-1}, std::int64_t{0}, second + 100}) {
        EXPECT_FALSE(qm::releaseExtension(never)) << never;
    }
    ASSERT_EQ(::unlink(file("f").c_str()), 0);
    EXPECT_TRUE(qm::verifyExtension(token).ok());
    EXPECT_EQ(qm::consumeExtension(token), -1) << "the path is gone";
}

}  // namespace
