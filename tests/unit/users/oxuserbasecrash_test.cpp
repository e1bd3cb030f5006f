// What the user files hold after a crash, on a full disk and under many writers.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/file.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <csignal>
#include <functional>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "platform/file.h"
#include "testing/waiting.h"
#include "userbasefixture.h"
#include "users/oxuserbase.h"

namespace {

class oxUserBaseCrash : public UserBaseTest {};

constexpr int NOT_POSSIBLE_HERE = 77;

// Runs the body in a process of its own, which may change what belongs to the whole process. Its exit status: 0 when
// no expectation failed there.
int InOwnProcess(const std::function<void()>& body) {
    const pid_t child = fork();
    if (child == 0) {
        body();
        std::fflush(nullptr);
        _exit(testing::Test::HasFailure() ? 1 : 0);
    }
    int status = -1;
    return child > 0 && waitpid(child, &status, 0) == child && WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Every operation that writes, with values of every length. Says on the descriptor when it is under way.
void ChangeForEver(const std::string& directory, int underWay) {
    oxUserBase users(directory);
    for (unsigned round = 0;; ++round) {
        if (round == 1)
            WriteAll(underWay, "x", 1);
        const std::string text = std::to_string(round);
        users.SetPassword("alice", "secret" + text);
        users.SetText1("alice", std::string(round % 3000, 'x') + text);
        users.SetPermissions("bob", round);
        users.SetText2("bob", text);
        users.AddUser("carol", "secret", round, text, text);
        users.DeleteUser("carol");
    }
}

// What must hold whenever no space is left for another file's text.
void ExpectChangesAreRefused(oxUserBase& users) {
    const std::uint64_t generation = users.Generation();
    EXPECT_FALSE(users.SetPassword("alice", "new"));
    EXPECT_FALSE(users.SetPermissions("alice", 99));
    EXPECT_FALSE(users.SetText1("alice", "changed"));
    EXPECT_FALSE(users.SetText2("alice", "77"));
    EXPECT_FALSE(users.SaveUser("alice"));
    EXPECT_FALSE(users.AddUser("bob", "secret", 1, "", ""));
    std::uint32_t permissions = 0;
    EXPECT_TRUE(users.Authenticate("alice", "secret", &permissions));
    EXPECT_EQ(3u, permissions);
    EXPECT_FALSE(users.Authenticate("alice", "new", nullptr));
    EXPECT_FALSE(users.FindUser("bob", nullptr));
    EXPECT_EQ(generation, users.Generation());
}

}  // namespace

TEST_F(oxUserBaseCrash, AKilledProcessLeavesEveryFileWhole) {
    constexpr int KILLS = 60;
    {
        oxUserBase users(Directory());
        ASSERT_TRUE(users.AddUser("alice", "secret", 1, "", ""));
        ASSERT_TRUE(users.AddUser("bob", "bobs", 1, "", ""));
        ASSERT_TRUE(users.AddUser("dave", "daves", 1, "5", "/dave"));
    }
    const std::string dave = TextOf("dave.usr");
    std::mt19937 random(20240607);
    std::uniform_int_distribution<int> microseconds(0, 30000);
    for (int round = 0; round < KILLS; ++round) {
        std::array<int, 2> pipe{};
        ASSERT_EQ(0, pipe2(pipe.data(), O_CLOEXEC));
        UniqueFd underWay(pipe[0]), sayUnderWay(pipe[1]);
        const pid_t child = fork();
        ASSERT_GE(child, 0);
        if (child == 0)
            ChangeForEver(Directory(), sayUnderWay.Get());
        char byte = 0;
        const bool begun = read(underWay.Get(), &byte, 1) == 1;
        std::this_thread::sleep_for(std::chrono::microseconds(microseconds(random)));  // a moment by chance
        ASSERT_EQ(0, kill(child, SIGKILL));
        EXPECT_TRUE(begun);
        int status = 0;
        ASSERT_EQ(child, waitpid(child, &status, 0));
        ASSERT_TRUE(WIFSIGNALED(status)) << "it ended by itself";
        for (const std::string& file : Files()) {
            if (file.front() == '.')
                continue;  // a text that did not become a user file
            const oxUserFile::Content content = oxUserFile::Parse(TextOf(file));
            ASSERT_EQ(oxUserFile::State::User, content.state) << file << "\n" << TextOf(file);
            ASSERT_EQ(content.record.name + ".usr", file);
            ASSERT_EQ('\n', TextOf(file).back());
        }
        EXPECT_EQ(dave, TextOf("dave.usr"));
        oxUserBase users(Directory());
        EXPECT_TRUE(users.FindUser("alice", nullptr));
        EXPECT_TRUE(users.Authenticate("bob", "bobs", nullptr));
        EXPECT_TRUE(users.Authenticate("dave", "daves", nullptr));
        for (const std::string& file : Files())
            ASSERT_NE('.', file.front()) << "what was left behind is gone";
    }
}

TEST_F(oxUserBaseCrash, AFullDiskRefusesChangesAndLosesNothing) {
    if (geteuid() != 0)
        GTEST_SKIP() << "mounting a small disk takes root; the limit on file sizes stands in for it below";
    const std::string disk = m_scratch.File("disk");
    std::filesystem::create_directory(disk);
    const int result = InOwnProcess([&] {
        if (unshare(CLONE_NEWNS) != 0 || mount("none", "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0 ||
            mount("none", disk.c_str(), "tmpfs", 0, "size=64k") != 0)
            _exit(NOT_POSSIBLE_HERE);
        oxUserBase users(disk + "/users");
        ASSERT_TRUE(users.AddUser("alice", "secret", 3, "5", "/alice"));
        const std::string text = m_scratch.Read("disk/users/alice.usr");
        {
            const UniqueFd filler = OpenFile(disk + "/filler", O_WRONLY | O_CREAT);
            const std::string block(1024, 'x');
            while (WriteAll(filler.Get(), block.data(), block.size())) {
            }
            ASSERT_EQ(ENOSPC, errno);
        }
        ExpectChangesAreRefused(users);
        EXPECT_EQ(text, m_scratch.Read("disk/users/alice.usr"));
        const std::filesystem::directory_iterator files(disk + "/users");
        EXPECT_EQ(1, std::distance(begin(files), end(files)));
        EXPECT_TRUE(oxUserBase(disk + "/users").Authenticate("alice", "secret", nullptr));
        std::filesystem::remove(disk + "/filler");
        EXPECT_TRUE(users.SetPassword("alice", "new")) << "with space again";
        EXPECT_TRUE(users.Authenticate("alice", "new", nullptr));
        EXPECT_TRUE(users.DeleteUser("alice"));
    });
    if (result == NOT_POSSIBLE_HERE)
        GTEST_SKIP() << "this root may not mount; the limit on file sizes stands in for the full disk below";
    EXPECT_EQ(0, result);
}

TEST_F(oxUserBaseCrash, AWriteThatFailsHalfwayChangesNothing) {
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 3, "5", "/alice"));
    const auto before = Texts();
    EXPECT_EQ(0, InOwnProcess([&] {
                  ASSERT_NE(SIG_ERR, std::signal(SIGXFSZ, SIG_IGN));
                  for (const rlim_t bytes : {0u, 1u, 20u, 60u}) {
                      const rlimit limit{.rlim_cur = bytes, .rlim_max = RLIM_INFINITY};
                      ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
                      ExpectChangesAreRefused(users);
                      EXPECT_EQ(before, Texts());
                  }
                  EXPECT_TRUE(users.DeleteUser("alice")) << "a removal needs no space";
              }));
}

TEST_F(oxUserBaseCrash, AFullDiskLeavesPlaintextPasswordsAndTheirUsers) {
    WriteUser("alice.usr", "alice", "PlaintextPassword=secret");
    Sealed("makes the key");
    const auto before = Texts();
    EXPECT_EQ(0, InOwnProcess([&] {
                  ASSERT_NE(SIG_ERR, std::signal(SIGXFSZ, SIG_IGN));
                  const rlimit limit{.rlim_cur = 20, .rlim_max = RLIM_INFINITY};
                  ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &limit));
                  oxUserBase users(Directory());
                  EXPECT_TRUE(users.Authenticate("alice", "secret", nullptr));
                  EXPECT_EQ(before, Texts());
                  const rlimit none{.rlim_cur = RLIM_INFINITY, .rlim_max = RLIM_INFINITY};
                  ASSERT_EQ(0, setrlimit(RLIMIT_FSIZE, &none));
                  EXPECT_TRUE(users.LoadAll());
                  EXPECT_EQ("secret", PasswordIn("alice.usr"));
              }));
}

TEST_F(oxUserBaseCrash, AReadOnlyDirectoryRefusesChanges) {
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 3, "5", "/alice"));
    const auto before = Texts();
    for (const std::string& path :
         {m_scratch.Path(), Directory(), m_scratch.File("ox_remote.key"), PathOf("alice.usr")})
        ASSERT_EQ(0, chmod(path.c_str(), 0555));
    EXPECT_EQ(0, InOwnProcess([&] {
                  if (geteuid() == 0) {
                      ASSERT_EQ(0, setresuid(1, 1, 1));
                  }
                  ExpectChangesAreRefused(users);
                  EXPECT_EQ(before, Texts());
                  EXPECT_FALSE(users.DeleteUser("alice"));
                  EXPECT_TRUE(users.FindUser("alice", nullptr));
              }));
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    ASSERT_EQ(0, chmod(Directory().c_str(), 0755));
}

TEST_F(oxUserBaseCrash, NoProcessUndoesTheChangesOfAnother) {
    constexpr int CHANGES = 40;
    struct Writer {
        bool (oxUserBase::*set)(const std::string&, const std::string&);
        const char* key;
        pid_t child;
    };
    Writer writers[] = {{&oxUserBase::SetText1, oxUserBase::m_pszINI_KEY_LOGFILEURL, -1},
                        {&oxUserBase::SetText2, oxUserBase::m_pszINI_KEY_MAXPROFILES, -1}};
    {
        oxUserBase users(Directory());
        ASSERT_TRUE(users.AddUser("shared", "secret", 0, "", ""));
    }
    for (Writer& writer : writers) {
        writer.child = fork();
        ASSERT_GE(writer.child, 0);
        if (writer.child == 0) {
            // The only one that sets this key: it always finds what it wrote last.
            oxUserBase users(Directory());
            std::string last = "-";
            bool good = true;
            for (int change = 0; change < CHANGES; ++change) {
                const std::string name = writer.key + std::to_string(change);
                good = good && KeyOf("shared.usr", writer.key) == last;
                last = std::to_string(change);
                good = good && (users.*writer.set)("shared", last) && users.AddUser(name, "secret", 1, "", "");
            }
            _exit(good ? 0 : 1);
        }
    }
    for (const Writer& writer : writers) {
        int status = -1;
        ASSERT_EQ(writer.child, waitpid(writer.child, &status, 0));
        EXPECT_EQ(0, status) << writer.key;
    }
    oxUserBase users(Directory());
    for (const Writer& writer : writers) {
        EXPECT_EQ(std::to_string(CHANGES - 1), KeyOf("shared.usr", writer.key));
        for (int change = 0; change < CHANGES; ++change)
            EXPECT_TRUE(users.FindUser(writer.key + std::to_string(change), nullptr));
    }
    EXPECT_EQ(1u + 2u * CHANGES, Files().size());
}

// A change waits while another process makes one, and those who log in do not wait with it.
TEST_F(oxUserBaseCrash, LoginsDoNotWaitForAnotherProcess) {
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 0, "", ""));
    const auto isWaiting = [this] {
        int open = 0;  // descriptors of the directory: that of the other process, and one of whoever waits
        for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
            std::error_code error;
            open += std::filesystem::read_symlink(entry.path(), error) == std::filesystem::canonical(Directory());
        }
        return open == 2;
    };
    unsigned permissions = 0;
    const auto logInWhileAChangeWaits = [&] {
        const UniqueFd other = OpenFile(Directory(), O_RDONLY | O_DIRECTORY);
        EXPECT_EQ(0, flock(other.Get(), LOCK_EX));
        std::atomic<bool> done{false};
        bool changed = false;
        std::thread change([&] {
            changed = users.SetPermissions("alice", permissions + 1);
            done = true;
        });
        const bool waited = Eventually([&] { return isWaiting() || done; }) && !done;
        std::uint32_t found = 99;
        bool good = users.Authenticate("alice", "secret", &found) && found == permissions;
        good = users.FindUser("alice", &found) && found == permissions && good;
        good = ListOf(users) == "u1=alice&p1=" + std::to_string(permissions) && good;
        const bool waits = isWaiting() && !done;
        EXPECT_EQ(0, flock(other.Get(), LOCK_UN));
        change.join();
        EXPECT_TRUE(changed);
        ++permissions;
        return waited && waits && good;
    };
    // A change waits for some time only, which a slow machine may let pass.
    constexpr int ATTEMPTS = 5;
    bool done = false;
    for (int i = 0; i < ATTEMPTS && !done; ++i)
        done = logInWhileAChangeWaits();
    EXPECT_TRUE(done);
    EXPECT_EQ("u1=alice&p1=" + std::to_string(permissions), ListOf(users));
}

TEST_F(oxUserBaseCrash, LoginsGoOnWhileUsersAreChanged) {
    constexpr int CHANGES = 40;
    oxUserBase users(Directory());
    ASSERT_TRUE(users.AddUser("alice", "secret", 3, "", ""));
    ASSERT_TRUE(users.AddUser("bob", "bobs", 1, "", ""));
    std::atomic<bool> stop{false};
    std::atomic<int> checks{0};
    std::vector<std::thread> threads;
    for (int i = 0; i < 3; ++i) {
        threads.emplace_back([&] {
            std::string buffer(1000, '\0');
            while (!stop) {
                std::uint32_t permissions = 0;
                ASSERT_TRUE(users.Authenticate("alice", "secret", &permissions)) << "never a moment without her";
                ASSERT_EQ(3u, permissions);
                ASSERT_TRUE(users.FindUser("bob", &permissions));
                users.ListUsers(buffer.data(), buffer.size());
                ASSERT_EQ(0, buffer.compare(0, 15, "u1=alice&p1=3&u"));
                users.Generation();
                ++checks;
            }
        });
    }
    std::thread reloader([&] {
        while (!stop)
            users.LoadAll();
    });
    for (unsigned i = 0; i < CHANGES; ++i) {
        EXPECT_TRUE(users.SetPermissions("bob", i));
        EXPECT_TRUE(users.SetPassword("bob", std::to_string(i)));
    }
    stop = true;
    reloader.join();
    for (std::thread& thread : threads)
        thread.join();
    EXPECT_GT(checks.load(), 0);
    EXPECT_TRUE(users.Authenticate("bob", std::to_string(CHANGES - 1), nullptr));
}
