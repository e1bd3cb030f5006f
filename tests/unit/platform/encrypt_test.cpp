#include "platform/encrypt.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <atomic>
#include <barrier>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "platform/file.h"
#include "testing/ordinaryuser.h"
#include "testing/scratch.h"

using namespace std::string_literals;

namespace {

constexpr std::string_view ALPHABET = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789-_";
constexpr std::size_t KEY_BYTES = 32;

// Every test has an installation of its own.
class Encrypt : public testing::Test {
protected:
    Encrypt() { SetEncryptionKeyFile(KeyFile()); }
    ~Encrypt() override { SetEncryptionKeyFile(DEFAULT_ENCRYPTION_KEY_FILE); }

    std::string KeyFile() const { return m_scratch.File("keys/ox_remote.key"); }
    std::string Key() const { return m_scratch.Read("keys/ox_remote.key"); }
    void WriteKey(const std::string& key) const { m_scratch.Write("keys/ox_remote.key", key); }
    std::size_t FilesBesideTheKey() const {
        const std::filesystem::directory_iterator files(m_scratch.File("keys"));
        return static_cast<std::size_t>(std::distance(begin(files), end(files)));
    }

    Scratch m_scratch;
};

std::string Sealed(std::string_view clear) {
    std::string sealed;
    EXPECT_TRUE(oxEncrypt(clear, sealed));
    return sealed;
}

void ExpectRefused(std::string_view sealed) {
    std::string clear = "what stood here before";
    EXPECT_FALSE(oxDecrypt(sealed, clear)) << sealed;
    EXPECT_EQ("", clear) << sealed;
}

void ExpectOpens(const std::string& clear, std::string_view sealed) {
    std::string opened = "what stood here before";
    EXPECT_TRUE(oxDecrypt(sealed, opened));
    EXPECT_EQ(clear, opened);
}

}  // namespace

TEST_F(Encrypt, WhatWasSealedOpensAgain) {
    const std::string texts[] = {
        "", "a", "&=+%", "caf\xC3\xA9 \xE2\x82\xAC", " blanks ", "\r\n\t", "a\0b"s, "\0"s, "\xFF\xFE\x80", "aaaa",
    };
    for (const std::string& text : texts)
        ExpectOpens(text, Sealed(text));
    for (std::size_t length = 0; length <= 351; ++length) {
        std::string text;
        for (std::size_t i = 0; i < length; ++i)
            text += static_cast<char>(i * 7 + length);
        ExpectOpens(text, Sealed(text));
    }
    ExpectOpens(std::string(65535, 'x'), Sealed(std::string(65535, 'x')));
}

TEST_F(Encrypt, TheSealedTextIsMadeOfPlainCharacters) {
    for (const char* text : {"", "a", "ab", "abc", "&=+%/ \n"}) {
        const std::string sealed = Sealed(text);
        EXPECT_EQ(std::string::npos, sealed.find_first_not_of(ALPHABET)) << sealed;
        EXPECT_EQ('a', sealed.front()) << "the form's letter";
    }
    // 24 bytes of nonce, 16 of tag, four characters for three bytes, the letter.
    EXPECT_EQ(1u + 54u, Sealed("").size());
    EXPECT_EQ(1u + 522u, Sealed(std::string(351, 'p')).size());
}

TEST_F(Encrypt, TwoSealingsOfOneTextDiffer) {
    std::set<std::string> sealed;
    for (int i = 0; i < 100; ++i)
        sealed.insert(Sealed("secret"));
    EXPECT_EQ(100u, sealed.size());
}

TEST_F(Encrypt, TheTextsMayBeOneObject) {
    std::string text = "secret";
    ASSERT_TRUE(oxEncrypt(text, text));
    EXPECT_NE("secret", text);
    ASSERT_TRUE(oxDecrypt(text, text));
    EXPECT_EQ("secret", text);
}

TEST_F(Encrypt, EveryChangedCharacterIsNoticed) {
    for (const char* text : {"", "a", "ab", "secret"}) {
        const std::string sealed = Sealed(text);
        for (std::size_t i = 0; i < sealed.size(); ++i) {
            for (const char other : std::string(ALPHABET) + "=+/ .\n"s + '\0' + '\xFF') {
                std::string changed = sealed;
                changed[i] = other;
                if (other != sealed[i])
                    ExpectRefused(changed);
            }
        }
    }
}

TEST_F(Encrypt, WhatIsNoSealedTextIsRefused) {
    const std::string sealed = Sealed("secret");
    for (std::size_t length = 0; length < sealed.size(); ++length)
        ExpectRefused(std::string_view(sealed).substr(0, length));
    const std::string refused[] = {
        sealed + "A",
        sealed + "=",
        sealed + "\n",
        sealed + '\0',
        " " + sealed,
        "A" + sealed,
        sealed + sealed,
        "b" + sealed.substr(1),
        "secret",
        "a",
        "a" + std::string(54, 'A'),
        std::string(1000, 'a'),
    };
    for (const std::string& text : refused)
        ExpectRefused(text);
}

TEST_F(Encrypt, TheKeyIsMadeOnceWithItsDirectories) {
    ExpectRefused("a" + std::string(60, 'A'));
    EXPECT_FALSE(std::filesystem::exists(m_scratch.File("keys"))) << "opening makes no key";
    const std::string sealed = Sealed("secret");
    const std::string key = Key();
    EXPECT_EQ(KEY_BYTES, key.size());
    EXPECT_EQ(1u, FilesBesideTheKey()) << "nothing is left beside it";
    struct stat status {};
    ASSERT_EQ(0, stat(KeyFile().c_str(), &status));
    EXPECT_EQ(0600u, status.st_mode & 07777);
    Sealed("another");
    EXPECT_EQ(key, Key());

    SetEncryptionKeyFile(KeyFile());  // as after a new start
    ExpectOpens("secret", sealed);
    ExpectOpens("another", Sealed("another"));
    EXPECT_EQ(key, Key());
}

TEST_F(Encrypt, TheModeDoesNotHangOnTheCreationMask) {
    const mode_t before = umask(0);
    Sealed("secret");
    umask(before);
    struct stat status {};
    ASSERT_EQ(0, stat(KeyFile().c_str(), &status));
    EXPECT_EQ(0600u, status.st_mode & 07777);
}

TEST_F(Encrypt, TheKeyIsKeptUntilAFileIsNamed) {
    const std::string sealed = Sealed("secret");
    const std::string key = Key();
    WriteKey(std::string(KEY_BYTES, 'k'));
    ExpectOpens("secret", sealed);
    SetEncryptionKeyFile(KeyFile());
    ExpectRefused(sealed);
    WriteKey(key);
    ExpectRefused(sealed);
    SetEncryptionKeyFile(KeyFile());
    ExpectOpens("secret", sealed);
}

TEST_F(Encrypt, AForgottenKeyIsReadAgain) {
    std::string sealed;
    std::string clear;
    ASSERT_TRUE(oxEncrypt("secret", sealed));
    const std::string key = m_scratch.Read("keys/ox_remote.key");
    m_scratch.Write("keys/ox_remote.key", std::string(KEY_BYTES, 'k'));
    EXPECT_TRUE(oxDecrypt(sealed, clear)) << "kept";
    ForgetEncryptionKey();
    EXPECT_FALSE(oxDecrypt(sealed, clear));
    m_scratch.Write("keys/ox_remote.key", key);
    EXPECT_FALSE(oxDecrypt(sealed, clear));
    ForgetEncryptionKey();
    EXPECT_TRUE(oxDecrypt(sealed, clear));
    EXPECT_EQ(clear, "secret");
}

TEST_F(Encrypt, AnotherKeyOpensNothing) {
    const std::string sealed = Sealed("secret");
    SetEncryptionKeyFile(m_scratch.File("keys/other.key"));
    ExpectRefused(sealed);
    Sealed("makes the other key");
    ExpectRefused(sealed);
}

TEST_F(Encrypt, ALostKeyThatReturnsCountsAgain) {
    const std::string sealed = Sealed("secret");
    std::filesystem::rename(KeyFile(), m_scratch.File("away"));
    SetEncryptionKeyFile(KeyFile());
    ExpectRefused(sealed);
    std::filesystem::rename(m_scratch.File("away"), KeyFile());
    ExpectOpens("secret", sealed);
}

TEST_F(Encrypt, ADamagedKeyFileIsNeitherUsedNorOverwritten) {
    const std::string sealed = Sealed("secret");
    for (const std::size_t size : {0u, 1u, 31u, 33u, 64u, 100000u}) {
        const std::string damaged(size, 'k');
        WriteKey(damaged);
        SetEncryptionKeyFile(KeyFile());
        std::string text = "what stood here before";
        EXPECT_FALSE(oxEncrypt("x", text)) << size;
        EXPECT_EQ("", text);
        ExpectRefused(sealed);
        EXPECT_EQ(damaged, Key()) << size;
        EXPECT_EQ(1u, FilesBesideTheKey());
    }
}

TEST_F(Encrypt, WhatIsNoKeyFileIsLeftAlone) {
    struct Case {
        const char* what;
        void (*make)(const std::string& path);
    };
    constexpr Case CASES[] = {
        {"a directory", [](const std::string& path) { ASSERT_EQ(0, mkdir(path.c_str(), 0700)); }},
        {"a pipe", [](const std::string& path) { ASSERT_EQ(0, mkfifo(path.c_str(), 0600)); }},
        {"a link to nothing", [](const std::string& path) { ASSERT_EQ(0, symlink("nowhere", path.c_str())); }},
        {"a link to itself", [](const std::string& path) { ASSERT_EQ(0, symlink(path.c_str(), path.c_str())); }},
    };
    for (const Case& c : CASES) {
        const Scratch place;
        const std::string path = place.File("ox_remote.key");
        c.make(path);
        struct stat before {};
        ASSERT_EQ(0, lstat(path.c_str(), &before));
        SetEncryptionKeyFile(path);
        std::string text;
        EXPECT_FALSE(oxEncrypt("x", text)) << c.what;
        EXPECT_FALSE(oxDecrypt("x", text)) << c.what;
        struct stat after {};
        ASSERT_EQ(0, lstat(path.c_str(), &after));
        EXPECT_EQ(before.st_ino, after.st_ino) << c.what;
        EXPECT_EQ(before.st_mode, after.st_mode) << c.what;
        const std::filesystem::directory_iterator files(place.Path());
        EXPECT_EQ(1, std::distance(begin(files), end(files))) << c.what;
    }
}

TEST_F(Encrypt, AnUnreadableKeyFileIsNotReplaced) {
    const std::string sealed = Sealed("secret");
    const std::string key = Key();
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0777));
    ASSERT_EQ(0, chmod(m_scratch.File("keys").c_str(), 0777));
    ASSERT_EQ(0, chmod(KeyFile().c_str(), 0));
    SetEncryptionKeyFile(KeyFile());
    AsOrdinaryUser([&] {
        std::string text;
        EXPECT_FALSE(oxEncrypt("x", text));
        ExpectRefused(sealed);
    });
    ASSERT_EQ(0, chmod(KeyFile().c_str(), 0600));
    EXPECT_EQ(key, Key());
    ExpectOpens("secret", sealed);
}

TEST_F(Encrypt, WithoutAPlaceForTheKeyNothingIsSealed) {
    m_scratch.Write("file", "in the way");
    SetEncryptionKeyFile(m_scratch.File("file/ox_remote.key"));
    std::string text = "what stood here before";
    EXPECT_FALSE(oxEncrypt("x", text));
    EXPECT_EQ("", text);
    EXPECT_EQ("in the way", m_scratch.Read("file"));

    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0555));
    SetEncryptionKeyFile(KeyFile());
    AsOrdinaryUser([] {
        std::string sealed;
        EXPECT_FALSE(oxEncrypt("x", sealed));
    });
    ASSERT_EQ(0, chmod(m_scratch.Path().c_str(), 0755));
    EXPECT_FALSE(std::filesystem::exists(m_scratch.File("keys")));
}

TEST_F(Encrypt, ARelativeKeyFileStandsInTheWorkingDirectory) {
    const std::filesystem::path before = std::filesystem::current_path();
    std::filesystem::current_path(m_scratch.Path());
    SetEncryptionKeyFile("bare.key");
    const std::string bare = Sealed("bare");
    SetEncryptionKeyFile(DEFAULT_ENCRYPTION_KEY_FILE);
    const std::string standard = Sealed("standard");
    SetEncryptionKeyFile(m_scratch.File("bare.key"));
    ExpectOpens("bare", bare);
    SetEncryptionKeyFile(m_scratch.File("oxm_oxx/datfiles/ox_remote.key"));
    ExpectOpens("standard", standard);
    std::filesystem::current_path(before);
}

TEST_F(Encrypt, ThreadsThatBeginAtOnceAgreeOnOneKey) {
    constexpr int THREADS = 8;
    constexpr int ROUNDS = 20;
    for (int round = 0; round < ROUNDS; ++round) {
        const Scratch place;
        SetEncryptionKeyFile(place.File("ox_remote.key"));
        std::barrier start(THREADS);
        std::vector<std::string> sealed(THREADS);
        std::vector<std::thread> threads;
        for (std::string& text : sealed) {
            threads.emplace_back([&] {
                start.arrive_and_wait();
                EXPECT_TRUE(oxEncrypt("secret", text));
                std::string clear;
                EXPECT_TRUE(oxDecrypt(text, clear));
            });
        }
        for (std::thread& thread : threads)
            thread.join();
        for (const std::string& text : sealed)
            ExpectOpens("secret", text);
    }
}

TEST_F(Encrypt, ProcessesThatBeginAtOnceAgreeOnOneKey) {
    constexpr int PROCESSES = 8;
    constexpr int ROUNDS = 20;
    for (int round = 0; round < ROUNDS; ++round) {
        const Scratch place;
        const std::string path = place.File("keys/ox_remote.key");
        std::array<int, 2> gate{};
        std::array<int, 2> results{};
        ASSERT_EQ(0, pipe2(gate.data(), O_CLOEXEC));
        ASSERT_EQ(0, pipe2(results.data(), O_CLOEXEC));
        UniqueFd gateIn(gate[0]), gateOut(gate[1]), resultsIn(results[0]), resultsOut(results[1]);
        std::vector<pid_t> children;
        for (int i = 0; i < PROCESSES; ++i) {
            const pid_t child = fork();
            ASSERT_GE(child, 0);
            if (child == 0) {
                gateOut.Reset();
                char byte = 0;
                const bool opened = read(gateIn.Get(), &byte, 1) == 0;
                SetEncryptionKeyFile(path);
                std::string sealed;
                const bool good = opened && oxEncrypt("secret", sealed);
                sealed += '\n';
                _exit(good && WriteAll(resultsOut.Get(), sealed.data(), sealed.size()) ? 0 : 1);
            }
            children.push_back(child);
        }
        resultsOut.Reset();
        gateOut.Reset();  // all go at once
        for (const pid_t child : children) {
            int status = -1;
            ASSERT_EQ(child, waitpid(child, &status, 0));
            EXPECT_EQ(0, status);
        }
        std::string all;
        std::array<char, 4096> block;
        for (ssize_t count = 0; (count = read(resultsIn.Get(), block.data(), block.size())) > 0;)
            all.append(block.data(), static_cast<std::size_t>(count));
        SetEncryptionKeyFile(path);
        std::istringstream lines(all);
        int count = 0;
        for (std::string line; std::getline(lines, line); ++count)
            ExpectOpens("secret", line);
        EXPECT_EQ(PROCESSES, count);
        const std::filesystem::directory_iterator files(place.File("keys"));
        EXPECT_EQ(1, std::distance(begin(files), end(files)));
    }
}

TEST_F(Encrypt, ManyThreadsSealAndOpenAtOnce) {
    constexpr int THREADS = 4;
    constexpr int TURNS = 500;
    std::vector<std::thread> threads;
    for (int thread = 0; thread < THREADS; ++thread) {
        threads.emplace_back([thread] {
            for (int turn = 0; turn < TURNS; ++turn) {
                const std::string text = std::to_string(thread) + ":" + std::to_string(turn);
                std::string sealed;
                std::string clear;
                ASSERT_TRUE(oxEncrypt(text, sealed));
                ASSERT_TRUE(oxDecrypt(sealed, clear));
                ASSERT_EQ(text, clear);
            }
        });
    }
    for (std::thread& thread : threads)
        thread.join();
}

TEST(EqualSecrets, ComparesEveryByte) {
    struct Case {
        std::string one;
        std::string other;
        bool equal;
    };
    const Case cases[] = {
        {"", "", true},
        {"a", "a", true},
        {"secret", "secret", true},
        {std::string(351, 'p'), std::string(351, 'p'), true},
        {"a\0b"s, "a\0b"s, true},
        {"", "a", false},
        {"a", "", false},
        {"a", "A", false},
        {"secret", "secreT", false},
        {"secret", "Secret", false},
        {"secret", "secre", false},
        {"secre", "secret", false},
        {"secret", "secret "s, false},
        {"a\0b"s, "a\0c"s, false},
        {"a", "a\0"s, false},
        {"\xE4", "\xC4", false},
    };
    for (const Case& c : cases)
        EXPECT_EQ(c.equal, EqualSecrets(c.one, c.other)) << c.one << " " << c.other;
}

TEST(WipeText, OverwritesAllThatTheTextHeld) {
    for (const std::size_t length : {6u, 100u, 351u}) {
        std::string text(length, 's');
        const char* const memory = text.data();
        text.resize(length / 2);
        const std::size_t capacity = text.capacity();
        WipeText(text);
        EXPECT_TRUE(text.empty());
        ASSERT_EQ(memory, text.data()) << "the same memory";
        ASSERT_EQ(capacity, text.capacity());
        text.resize(capacity, 'x');
        ASSERT_EQ(memory, text.data());
        text.clear();
        WipeText(text);
        for (std::size_t i = 0; i < length; ++i)
            EXPECT_EQ('\0', memory[i]) << i;
    }
}
