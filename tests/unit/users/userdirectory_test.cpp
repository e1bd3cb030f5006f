#include "users/userdirectory.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/directory.h"
#include "testing/scratch.h"
#include "testing/waiting.h"

using namespace std::string_literals;

namespace {

std::vector<std::string> Names(const std::string& directory) {
    std::vector<std::string> names;
    for (const auto& entry : std::filesystem::directory_iterator(directory))
        names.push_back(entry.path().filename());
    std::sort(names.begin(), names.end());
    return names;
}

mode_t ModeOf(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

using List = std::vector<std::string>;

}  // namespace

TEST(oxUserDirectory, TheNamesOfNewFiles) {
    struct Case {
        std::string user;
        const char* stem;
    };
    const Case cases[] = {
        {"alice", "alice"},
        {"Alice.Smith_2-x@example.org", "Alice.Smith_2-x@example.org"},
        {"bob smith", "bob%20smith"},
        {"a/b", "a%2Fb"},
        {"../../wwwroot/x", "%2E.%2F..%2Fwwwroot%2Fx"},
        {".", "%2E"},
        {"..", "%2E."},
        {".hidden", "%2Ehidden"},
        {"a%b", "a%25b"},
        {"%41", "%2541"},
        {"domain\\user", "domain%5Cuser"},
        {"caf\xC3\xA9", "caf%C3%A9"},
        {"a*?[x]~\"'`$", "a%2A%3F%5Bx%5D%7E%22%27%60%24"},
        {"-rf", "-rf"},
        {"a\0b"s, "a%00b"},
        {"A-Z[`{", "A-Z%5B%60%7B"},
    };
    for (const Case& c : cases)
        EXPECT_EQ(c.stem, oxUserDirectory::StemOf(c.user)) << c.user;
}

TEST(oxUserDirectory, LongNamesAreCutAndStillTellUsersApart) {
    EXPECT_EQ(std::string(200, 'a'), oxUserDirectory::StemOf(std::string(200, 'a')));
    std::set<std::string> stems;
    for (const std::string& name : {std::string(201, 'a'), std::string(202, 'a'), std::string(255, 'a'),
                                    std::string(254, 'a') + "b", std::string(67, '/'), std::string(255, '/')}) {
        const std::string stem = oxUserDirectory::StemOf(name);
        EXPECT_EQ(oxUserDirectory::MAX_STEM, stem.size());
        EXPECT_EQ(stem, oxUserDirectory::StemOf(name)) << "the same each time";
        EXPECT_EQ(std::string::npos, stem.find('/'));
        EXPECT_TRUE(stems.insert(stem).second);
    }
    EXPECT_EQ(std::string(183, 'a') + "-", oxUserDirectory::StemOf(std::string(255, 'a')).substr(0, 184));
}

TEST(oxUserDirectory, IsMadeForItsOwnerOnly) {
    const mode_t before = umask(0);
    const Scratch scratch;
    const oxUserDirectory directory(scratch.File("a/b/users"));
    EXPECT_TRUE(directory.Create());
    umask(before);
    EXPECT_EQ(0700u, ModeOf(directory.Path()));
    EXPECT_EQ(0755u, ModeOf(scratch.File("a/b")));
    EXPECT_TRUE(directory.Create()) << "it is there";
    ASSERT_EQ(0, chmod(directory.Path().c_str(), 0750));
    EXPECT_TRUE(directory.Create());
    EXPECT_EQ(0750u, ModeOf(directory.Path())) << "what the administrator set stays";
    EXPECT_FALSE(oxUserDirectory("").Create());
    scratch.Write("file", "");
    EXPECT_FALSE(oxUserDirectory(scratch.File("file")).Create());
    EXPECT_FALSE(oxUserDirectory(scratch.File("file/users")).Create());
}

TEST(oxUserDirectory, ReplacesAFileWhole) {
    const mode_t before = umask(0);
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    scratch.Write("alice.usr", "old");
    ASSERT_EQ(0, chmod(scratch.File("alice.usr").c_str(), 0666));
    const UniqueFd reader = OpenFile(scratch.File("alice.usr"), O_RDONLY);
    EXPECT_TRUE(directory.Replace("alice.usr", "new text"));
    umask(before);
    EXPECT_EQ("new text", scratch.Read("alice.usr"));
    EXPECT_EQ(0600u, ModeOf(scratch.File("alice.usr")));
    std::array<char, 16> block{};
    EXPECT_EQ(3, read(reader.Get(), block.data(), block.size()));
    EXPECT_STREQ("old", block.data()) << "whoever reads the old file reads all of it";
    EXPECT_TRUE(directory.Replace("bob.usr", "")) << "a missing file is made";
    EXPECT_EQ((List{"alice.usr", "bob.usr"}), Names(scratch.Path()));
    const std::string longest = std::string(251, 'n') + ".usr";
    EXPECT_TRUE(directory.Replace(longest, "x")) << "names by hand may be as long as names can be";
    EXPECT_EQ("x", scratch.Read(longest));
    EXPECT_EQ(3u, Names(scratch.Path()).size());
}

TEST(oxUserDirectory, AFailedReplacementLeavesNothingBehind) {
    const Scratch scratch;
    EXPECT_FALSE(oxUserDirectory(scratch.File("missing")).Replace("a.usr", "x"));
    ASSERT_EQ(0, mkdir(scratch.File("a.usr").c_str(), 0700));
    EXPECT_FALSE(oxUserDirectory(scratch.Path()).Replace("a.usr", "x")) << "a directory has the name";
    EXPECT_EQ(List{"a.usr"}, Names(scratch.Path()));
}

TEST(oxUserDirectory, ANewFileTakesNoNameThatSomethingHas) {
    const mode_t before = umask(0);
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    scratch.Write("bob.usr", "somebody else");
    ASSERT_EQ(0, mkdir(scratch.File("bob-1.usr").c_str(), 0700));
    ASSERT_EQ(0, symlink("nowhere", scratch.File("bob-2.usr").c_str()));
    std::string name;
    EXPECT_TRUE(directory.Add("bob", "one", name));
    EXPECT_EQ("bob-3.usr", name);
    EXPECT_TRUE(directory.Add("bob", "two", name));
    EXPECT_EQ("bob-4.usr", name);
    EXPECT_TRUE(directory.Add("a/b", "three", name));
    EXPECT_EQ("a%2Fb.usr", name);
    umask(before);
    EXPECT_EQ("somebody else", scratch.Read("bob.usr"));
    EXPECT_EQ("one", scratch.Read("bob-3.usr"));
    EXPECT_EQ("two", scratch.Read("bob-4.usr"));
    EXPECT_EQ("three", scratch.Read("a%2Fb.usr"));
    EXPECT_EQ(0600u, ModeOf(scratch.File("bob-3.usr")));
    EXPECT_EQ((List{"a%2Fb.usr", "bob-1.usr", "bob-2.usr", "bob-3.usr", "bob-4.usr", "bob.usr"}),
              Names(scratch.Path()));
    EXPECT_FALSE(oxUserDirectory(scratch.File("missing")).Add("bob", "x", name));
}

TEST(oxUserDirectory, RemovesFiles) {
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    scratch.Write("bob.usr", "");
    EXPECT_TRUE(directory.Remove("bob.usr"));
    EXPECT_EQ(List{}, Names(scratch.Path()));
    EXPECT_TRUE(directory.Remove("bob.usr")) << "it is gone";
    ASSERT_EQ(0, mkdir(scratch.File("bob.usr").c_str(), 0700));
    EXPECT_FALSE(directory.Remove("bob.usr"));
}

TEST(oxUserDirectory, RemovesWhatCrashesLeftAndNothingElse) {
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    const List kept{".alice.usr",           ".alice.usr.tmp-", ".alice.usr.tmp-1234567", ".hidden", "alice.usr",
                    "alice.usr.tmp-123456", "notes.txt"};
    for (const std::string& name : kept)
        scratch.Write(name, "");
    for (const char* name : {".alice.usr.tmp-123456", ".bob smith.usr.tmp-AbCdEf", ".%2F.usr.tmp-zzzzzz"})
        scratch.Write(name, "");
    {
        const oxUserDirectory::Lock other(directory);
        ASSERT_TRUE(other);
        const oxUserDirectory::Lock none(oxUserDirectory(scratch.File("missing")));
        EXPECT_FALSE(none);
        directory.RemoveLeftovers(none);
        EXPECT_EQ(kept.size() + 3, Names(scratch.Path()).size()) << "not without the lock";
        directory.RemoveLeftovers(other);
    }
    EXPECT_EQ(kept, Names(scratch.Path()));
}

TEST(oxUserDirectory, TheLockIsHeldByOneAtATime) {
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    std::atomic<int> holders{0};
    std::atomic<int> turns{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([&] {
            for (int turn = 0; turn < 20; ++turn) {
                const oxUserDirectory::Lock lock(directory);
                if (!lock)
                    continue;  // a slow machine: the others were longer than the patience lasts
                EXPECT_EQ(1, ++holders);
                std::this_thread::yield();
                --holders;
                ++turns;
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_GE(turns.load(), 20);
    EXPECT_EQ(List{}, Names(scratch.Path())) << "the lock leaves no file";
}

TEST(oxUserDirectory, ALockThatIsNeverGivenBackIsNotWaitedForForEver) {
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    const UniqueFd stuck = OpenFile(scratch.Path(), O_RDONLY | O_DIRECTORY);
    ASSERT_EQ(0, flock(stuck.Get(), LOCK_EX));
    const auto start = std::chrono::steady_clock::now();
    EXPECT_FALSE(oxUserDirectory::Lock(directory));
    EXPECT_GE(std::chrono::steady_clock::now() - start,
              std::chrono::milliseconds(oxUserDirectory::PATIENCE_MILLISECONDS));
}

TEST(oxUserDirectory, TheLockIsGivenBackAlthoughAChildStillHasIt) {
    const Scratch scratch;
    const oxUserDirectory directory(scratch.Path());
    std::array<int, 2> gate{};
    ASSERT_EQ(0, pipe2(gate.data(), O_CLOEXEC));
    UniqueFd gateIn(gate[0]), gateOut(gate[1]);
    pid_t child = -1;
    {
        const oxUserDirectory::Lock lock(directory);
        ASSERT_TRUE(lock);
        child = fork();
        ASSERT_GE(child, 0);
        if (child == 0) {  // as one that is being started
            gateOut.Reset();
            char byte = 0;
            _exit(read(gateIn.Get(), &byte, 1) == 0 ? 0 : 1);
        }
    }
    EXPECT_TRUE(oxUserDirectory::Lock(directory));
    gateOut.Reset();
    int status = -1;
    EXPECT_EQ(child, waitpid(child, &status, 0));
    EXPECT_EQ(0, status);
}
