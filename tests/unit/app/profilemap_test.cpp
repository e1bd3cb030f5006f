#include "app/profilemap.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <fstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/identitycalls.h"
#include "testing/scratch.h"

using namespace std::string_literals;

namespace {

using Users = oxxProfileMap::Users;

class oxxProfileMapTest : public testing::Test {
protected:
    void Profile(const std::string& name, const std::string& users) const {
        dir.Write(name, "[Profile]\nUsers=" + users + "\n");
    }
    void Load() { map.Load(dir.Path()); }
    std::string List(const std::string& user, std::size_t size = 65535) const {
        std::vector<char> buffer(size + 1, 'x');
        map.ListProfiles(user, buffer.data(), size);
        EXPECT_EQ(buffer[size], 'x');
        return buffer.data();
    }

    Scratch dir;
    oxxProfileMap map;
};

// Makes a file unreadable for anybody: a directory in its place.
void MakeUnreadable(const std::string& path) {
    std::filesystem::remove(path);
    std::filesystem::create_directory(path);
}

}  // namespace

TEST_F(oxxProfileMapTest, UserListsAreScanned) {
    static const struct {
        const char* list;
        Users users;
    } CASES[] = {
        {"", {"admin"}},
        {"alice", {"alice", "admin"}},
        {"alice,bob", {"alice", "bob", "admin"}},
        {", alice,,bob", {"alice", "bob", "admin"}},
        {"alice ,bob", {"alice ", "bob", "admin"}},
        {"alice,   bob", {"alice", "bob", "admin"}},
        {"alice smith,  bob  jones ,carol", {"alice smith", "bob  jones ", "carol", "admin"}},
        {",,, , ,", {"admin"}},
        {" , alice , , ", {"alice ", "admin"}},
        {"alice,", {"alice", "admin"}},
        {"alice,alice", {"alice", "alice", "admin"}},
        {"admin,alice", {"admin", "alice", "admin"}},
        {"Alice,alice", {"Alice", "alice", "admin"}},
        {"domain\\alice;bob,x=y,#z", {"domain\\alice;bob", "x=y", "#z", "admin"}},
        {"a,\tb", {"a", "\tb", "admin"}},
        // The ends of a value are trimmed when the file is read, so a last name loses its blanks.
        {"  alice,bob  ", {"alice", "bob", "admin"}},
    };
    for (const auto& c : CASES) {
        Users users{"left over"};
        EXPECT_TRUE(oxxProfileMap::ReadUsers("[Profile]\nUsers="s + c.list + "\n", users));
        EXPECT_EQ(users, c.users) << c.list;
    }
}

TEST_F(oxxProfileMapTest, FilesAreSettingsFiles) {
    static const struct {
        std::string text;
        Users users;
    } CASES[] = {
        {"", {"admin"}},
        {"no settings at all", {"admin"}},
        {"Users=alice\n", {"admin"}},
        {"[Other]\nUsers=alice\n", {"admin"}},
        {"[profile]\r\nUSERS = alice , bob\r\n", {"alice ", "bob", "admin"}},
        {"; comment\n[Profile]\nUser=x\nUsers=alice\nUsers=bob\n", {"bob", "admin"}},
        {"[Profile]\nUsers=" + std::string(5000, 'a') + ",b\n", {std::string(5000, 'a'), "b", "admin"}},
    };
    for (const auto& c : CASES) {
        Users users;
        EXPECT_TRUE(oxxProfileMap::ReadUsers(c.text, users));
        EXPECT_EQ(users, c.users) << c.text;
    }
    Users users;
    EXPECT_FALSE(oxxProfileMap::ReadUsers("[Profile]\nUsers=al\0ice\n"s, users));
}

TEST_F(oxxProfileMapTest, EmptyUntilLoaded) {
    EXPECT_FALSE(map.IsPermitted("admin", "sales.wlp"));
    EXPECT_EQ(List("admin"), "");
}

TEST_F(oxxProfileMapTest, ThoseListedAndAdminArePermitted) {
    Profile("sales.wlp", "alice, bob");
    Profile("stock.wlp", "bob");
    Profile("empty.wlp", "");
    Profile("notes.txt", "alice");
    Profile(".hidden.wlp", "alice");
    Profile("upper.WLP", "alice");
    Load();
    static const struct {
        const char* user;
        const char* profile;
        bool permitted;
    } CASES[] = {
        {"alice", "sales.wlp", true},
        {"bob", "sales.wlp", true},
        {"admin", "sales.wlp", true},
        {"alice", "stock.wlp", false},
        {"bob", "stock.wlp", true},
        {"admin", "stock.wlp", true},
        {"admin", "empty.wlp", true},
        {"alice", "empty.wlp", false},
        {"Alice", "sales.wlp", false},
        {"alice ", "sales.wlp", false},
        {"alic", "sales.wlp", false},
        {"", "sales.wlp", false},
        {"alice", "Sales.wlp", false},
        {"alice", "sales.WLP", false},
        {"alice", "sales.wlp ", false},
        {"alice", "", false},
        {"admin", "", false},
        {"admin", "none.wlp", false},
        {"alice", "notes.txt", false},
        {"admin", "notes.txt", false},
        {"alice", ".hidden.wlp", false},
        {"alice", "upper.WLP", false},
        {"nobody", "sales.wlp", false},
        // Without the ending.
        {"alice", "sales", true},
        {"bob", "stock", true},
        {"alice", "stock", false},
        {"admin", "empty", true},
        {"alice", "Sales", false},
        {"alice", "sales.", false},
        {"alice", "sale", false},
        {"alice", ".hidden", false},
        {"admin", "notes", false},
    };
    for (const auto& c : CASES)
        EXPECT_EQ(map.IsPermitted(c.user, c.profile), c.permitted) << c.user << " " << c.profile;
}

TEST_F(oxxProfileMapTest, ExactIdentifierComesBeforeTheOneWithTheEnding) {
    Profile("a.wlp", "alice");
    Profile("a.wlp.wlp", "bob");
    Profile("b.wlp.wlp", "bob");
    Load();
    EXPECT_TRUE(map.IsPermitted("alice", "a.wlp"));
    EXPECT_FALSE(map.IsPermitted("bob", "a.wlp")) << "that profile exists, and does not list bob";
    EXPECT_TRUE(map.IsPermitted("bob", "a.wlp.wlp"));
    EXPECT_TRUE(map.IsPermitted("bob", "b.wlp"));
    EXPECT_FALSE(map.IsPermitted("bob", "b"));
    EXPECT_TRUE(map.IsPermitted("alice", "a"));
}

TEST_F(oxxProfileMapTest, ProfilesAreListedInOrderWithDuplicates) {
    Profile("sales.wlp", "alice,alice,bob");
    Profile("Zoo.wlp", "alice");
    Profile("a b.wlp", "alice");
    Load();
    EXPECT_EQ(List("alice"), "profile_id=Zoo.wlp&profile_id=a b.wlp&profile_id=sales.wlp&profile_id=sales.wlp");
    EXPECT_EQ(List("bob"), "profile_id=sales.wlp");
    EXPECT_EQ(List("admin"), "profile_id=Zoo.wlp&profile_id=a b.wlp&profile_id=sales.wlp");
    EXPECT_EQ(List("nobody"), "");
    Profile("Zoo.wlp", "bob,alice");
    map.Refresh("Zoo.wlp");
    EXPECT_EQ(List("alice"), "profile_id=Zoo.wlp&profile_id=a b.wlp&profile_id=sales.wlp&profile_id=sales.wlp")
        << "a refresh changes no order";
}

TEST_F(oxxProfileMapTest, ListStopsWhenRoomRunsShort) {
    // The first pair takes 16 bytes ("profile_id=a.wlp"), each further one 17.
    for (const char* name : {"a.wlp", "b.wlp", "c.wlp"})
        Profile(name, "alice");
    Load();
    const std::string one = "profile_id=a.wlp";
    const std::string two = one + "&profile_id=b.wlp";
    const std::string three = two + "&profile_id=c.wlp";
    static const struct {
        std::size_t size;
        std::string list;
    } CASES[] = {{1, ""},    {2, ""},    {100, ""},    {101, one},    {116, one},
                 {117, two}, {133, two}, {134, three}, {65535, three}};
    for (const auto& c : CASES)
        EXPECT_EQ(List("alice", c.size), c.list) << c.size;
    char untouched = 'x';
    map.ListProfiles("alice", &untouched, 0);
    EXPECT_EQ(untouched, 'x');
}

TEST_F(oxxProfileMapTest, ListHoldsWholePairsOnly) {
    const std::string name = std::string(246, 'n') + ".wlp";
    Profile(name, "alice");
    Profile("a.wlp", "alice");
    Load();
    const std::string first = "profile_id=a.wlp";
    const std::string both = first + "&profile_id=" + name;
    EXPECT_EQ(List("alice", both.size() + 1), both);
    EXPECT_EQ(List("alice", both.size()), first) << "the terminating zero needs room too";
    EXPECT_EQ(List("alice", 200), first);
}

TEST_F(oxxProfileMapTest, ListOfManyLongNamesStaysInsideTheBuffer) {
    for (int i = 100; i < 400; ++i)
        dir.Write(std::to_string(i) + std::string(243, 'n') + ".wlp", "");
    Load();
    const std::string list = List("admin");
    constexpr std::size_t PAIR = 11 + 250 + 1;
    EXPECT_EQ(list.size() % PAIR, PAIR - 1) << "no pair is cut";
    EXPECT_GT(list.size(), 65535 - 101 - PAIR);
    EXPECT_LT(list.size(), 65535u);
}

TEST_F(oxxProfileMapTest, LoadForgetsWhatIsGone) {
    Profile("sales.wlp", "alice");
    Profile("stock.wlp", "alice");
    Load();
    std::filesystem::remove(dir.File("sales.wlp"));
    Profile("stock.wlp", "bob");
    Load();
    EXPECT_FALSE(map.IsPermitted("alice", "sales.wlp"));
    EXPECT_FALSE(map.IsPermitted("admin", "sales.wlp"));
    EXPECT_FALSE(map.IsPermitted("alice", "stock.wlp"));
    EXPECT_TRUE(map.IsPermitted("bob", "stock.wlp"));
    std::filesystem::remove(dir.File("stock.wlp"));
    Load();
    EXPECT_FALSE(map.IsPermitted("admin", "stock.wlp")) << "no profiles are no failure";
}

TEST_F(oxxProfileMapTest, DirectoryThatCannotBeListedKeepsTheOldEntries) {
    Profile("sales.wlp", "alice");
    Load();
    const std::filesystem::path aside = dir.Path() + ".aside";
    std::filesystem::rename(dir.Path(), aside);
    Load();
    std::filesystem::rename(aside, dir.Path());
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
}

TEST_F(oxxProfileMapTest, AnotherDirectoryTakesTheOldEntriesAwayWhateverIsInIt) {
    for (const std::string& directory : {dir.File("none"), dir.File("sales.wlp"), std::string()}) {
        Profile("sales.wlp", "alice");
        Load();
        EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
        map.Load(directory);
        EXPECT_FALSE(map.IsPermitted("alice", "sales.wlp")) << directory;
    }
}

TEST_F(oxxProfileMapTest, LoadKeepsTheEntriesOfFilesThatCannotBeRead) {
    Profile("sales.wlp", "alice");
    Profile("stock.wlp", "alice");
    Load();
    MakeUnreadable(dir.File("sales.wlp"));
    MakeUnreadable(dir.File("new.wlp"));
    Profile("stock.wlp", "bob");
    Load();
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
    EXPECT_FALSE(map.IsPermitted("alice", "stock.wlp"));
    EXPECT_FALSE(map.IsPermitted("admin", "new.wlp")) << "never read";
    dir.Write("stock.wlp", "[Profile]\nUsers=al\0ice\n"s);
    Load();
    EXPECT_TRUE(map.IsPermitted("bob", "stock.wlp")) << "damaged files too";
}

TEST_F(oxxProfileMapTest, DanglingLinkIsNoProfile) {
    Profile("target", "alice");
    std::filesystem::create_symlink(dir.File("target"), dir.File("link.wlp"));
    Profile("sales.wlp", "alice");
    Load();
    EXPECT_EQ(List("alice"), "profile_id=link.wlp&profile_id=sales.wlp");
    std::filesystem::remove(dir.File("target"));
    Load();
    EXPECT_EQ(List("admin"), "profile_id=sales.wlp");
}

TEST_F(oxxProfileMapTest, RefreshReadsOneProfileAgain) {
    Profile("sales.wlp", "alice,bob");
    Profile("stock.wlp", "alice");
    Load();
    Profile("sales.wlp", "bob,carol");
    Profile("stock.wlp", "dave");
    map.Refresh("sales.wlp");
    EXPECT_FALSE(map.IsPermitted("alice", "sales.wlp"));
    EXPECT_TRUE(map.IsPermitted("bob", "sales.wlp"));
    EXPECT_TRUE(map.IsPermitted("carol", "sales.wlp"));
    EXPECT_TRUE(map.IsPermitted("admin", "sales.wlp"));
    EXPECT_TRUE(map.IsPermitted("alice", "stock.wlp")) << "the other one was not asked for";
    EXPECT_EQ(List("bob"), "profile_id=sales.wlp") << "once";
}

TEST_F(oxxProfileMapTest, RefreshTakesNewProfilesAndDropsThoseThatAreGone) {
    Load();
    Profile("sales.wlp", "alice");
    map.Refresh("sales.wlp");
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
    Profile("stock.wlp", "alice");
    map.Refresh("stock");
    EXPECT_TRUE(map.IsPermitted("alice", "stock.wlp"));
    std::filesystem::remove(dir.File("sales.wlp"));
    map.Refresh("sales.wlp");
    EXPECT_EQ(List("alice"), "profile_id=stock.wlp");
    EXPECT_FALSE(map.IsPermitted("admin", "sales.wlp"));
    std::filesystem::remove(dir.File("stock.wlp"));
    map.Refresh("stock");
    EXPECT_EQ(List("admin"), "");
    map.Refresh("stock");
    EXPECT_EQ(List("admin"), "");
}

TEST_F(oxxProfileMapTest, RefreshTakesTheExactIdentifierFirst) {
    Profile("a.wlp", "alice");
    Profile("a.wlp.wlp", "bob");
    Load();
    Profile("a.wlp", "carol");
    Profile("a.wlp.wlp", "dave");
    map.Refresh("a.wlp");
    EXPECT_TRUE(map.IsPermitted("carol", "a.wlp"));
    EXPECT_TRUE(map.IsPermitted("bob", "a.wlp.wlp")) << "not read";
    std::filesystem::remove(dir.File("a.wlp"));
    map.Refresh("a.wlp");
    EXPECT_TRUE(map.IsPermitted("bob", "a.wlp.wlp")) << "the file that is gone was meant";
    EXPECT_EQ(List("admin"), "profile_id=a.wlp.wlp");
    map.Refresh("a.wlp");
    EXPECT_TRUE(map.IsPermitted("dave", "a.wlp.wlp")) << "now nothing has the exact name";
}

TEST_F(oxxProfileMapTest, RefreshKeepsTheEntriesOfAFileThatCannotBeRead) {
    Profile("sales.wlp", "alice");
    Load();
    MakeUnreadable(dir.File("sales.wlp"));
    map.Refresh("sales.wlp");
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
    std::filesystem::remove(dir.File("sales.wlp"));
    ASSERT_EQ(mkfifo(dir.File("sales.wlp").c_str(), 0600), 0);
    map.Refresh("sales.wlp");
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp")) << "a pipe is not waited for";
    std::filesystem::remove(dir.File("sales.wlp"));
    dir.Write("sales.wlp", "[Profile]\nUsers=x\0y\n"s);
    map.Refresh("sales.wlp");
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
    EXPECT_EQ(List("admin"), "profile_id=sales.wlp");
}

TEST_F(oxxProfileMapTest, FileWithoutReadPermissionKeepsItsEntries) {
    Profile("sales.wlp", "alice");
    ASSERT_EQ(chmod(dir.Path().c_str(), 0755), 0);
    Load();
    ASSERT_EQ(chmod(dir.File("sales.wlp").c_str(), 0), 0);
    std::thread([this] {
        constexpr uid_t NOBODY = 65534;
        ASSERT_TRUE(geteuid() != 0 || syscall(SET_USERS_CALL, UNCHANGED_USER, NOBODY, UNCHANGED_USER) == 0);
        ASSERT_FALSE(std::ifstream(dir.File("sales.wlp")).is_open());
        map.Refresh("sales.wlp");
        Load();
    }).join();
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
}

TEST_F(oxxProfileMapTest, RefreshReadsOnlyNamesOfProfiles) {
    Profile("profiles/sales.wlp", "alice");
    Profile("users/bob.usr", "mallory");
    Profile("users/bob.wlp", "mallory");
    Profile("outside.wlp", "mallory");
    Profile("profiles/.hidden.wlp", "mallory");
    Profile("profiles/other.txt", "mallory");
    Profile("profiles/sub/x.wlp", "mallory");
    Profile("profiles/.wlp", "mallory");
    map.Load(dir.File("profiles"));
    const std::string names[] = {
        "../users/bob.usr",
        "../users/bob.wlp",
        "../users/bob",
        "../outside",
        "../outside.wlp",
        dir.File("outside.wlp"),
        "/dev/zero",
        "sub/x.wlp",
        "sub/x",
        ".hidden.wlp",
        ".hidden",
        ".wlp",
        ".",
        "..",
        "",
        "other.txt",
        "./sales.wlp",
        "sales.wlp/",
        "sales.wlp\0.wlp"s,
        "sales\0"s,
        std::string(5000, 'a'),
    };
    for (const std::string& name : names) {
        map.Refresh(name);
        EXPECT_EQ(List("admin"), "profile_id=sales.wlp") << name;
        EXPECT_EQ(List("mallory"), "") << name;
    }
    EXPECT_TRUE(map.IsPermitted("alice", "sales.wlp"));
}

TEST_F(oxxProfileMapTest, RefreshBeforeALoadReadsNothing) {
    const auto before = std::filesystem::current_path();
    Profile("sales.wlp", "alice");
    std::filesystem::current_path(dir.Path());
    map.Refresh("sales.wlp");
    std::filesystem::current_path(before);
    EXPECT_EQ(List("admin"), "");
}

// Who is permitted before and after is permitted in between.
TEST_F(oxxProfileMapTest, ChangesShowNoGap) {
    constexpr int READERS = 8;
    constexpr int ROUNDS = 300;
    for (int i = 0; i < 20; ++i)
        Profile("p" + std::to_string(i) + ".wlp", "alice,bob");
    Load();
    const std::string all = List("alice");
    std::atomic<bool> done{false};
    std::atomic<int> refused{0};
    std::atomic<long> asked{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < READERS; ++t) {
        threads.emplace_back([&, t] {
            while (!done) {
                refused += !map.IsPermitted("alice", "p" + std::to_string(t) + ".wlp");
                refused += !map.IsPermitted("bob", "p" + std::to_string(t));
                refused += map.IsPermitted("mallory", "p0.wlp");
                refused += List("alice") != all;
                ++asked;
            }
        });
    }
    std::thread loader([&] {
        for (int i = 0; i < ROUNDS / 10; ++i)
            map.Load(dir.Path());
    });
    for (int i = 0; i < ROUNDS; ++i)
        map.Refresh("p" + std::to_string(i % READERS) + (i % 2 == 0 ? ".wlp" : ""));
    loader.join();
    done = true;
    for (auto& thread : threads)
        thread.join();
    EXPECT_EQ(refused, 0);
    EXPECT_GT(asked, 0);
}

// Nor does another directory: whom both permit is permitted all the time, and a list is that of the one or of the
// other.
TEST_F(oxxProfileMapTest, AnotherDirectoryShowsNoGap) {
    constexpr int READERS = 4;
    constexpr long ROUNDS = 300;
    for (const char* directory : {"one", "other"}) {
        for (const char* both : {"p.wlp", "q.wlp"})
            Profile(directory + "/"s + both, "alice,bob");
        Profile(directory + "/"s + directory + ".wlp", "alice");
    }
    map.Load(dir.File("other"));
    const std::string other = List("alice");
    map.Load(dir.File("one"));
    const std::string one = List("alice");
    ASSERT_EQ(one, "profile_id=one.wlp&profile_id=p.wlp&profile_id=q.wlp");
    ASSERT_EQ(other, "profile_id=other.wlp&profile_id=p.wlp&profile_id=q.wlp");
    std::atomic<bool> done{false};
    std::atomic<int> refused{0};
    std::atomic<long> seenOne{0}, seenOther{0};
    std::vector<std::thread> readers;
    for (int t = 0; t < READERS; ++t) {
        readers.emplace_back([&] {
            while (!done) {
                refused += !map.IsPermitted("alice", "p.wlp");
                refused += !map.IsPermitted("bob", "q");
                refused += !map.IsPermitted("admin", "p.wlp");
                refused += map.IsPermitted("mallory", "p.wlp");
                const std::string list = List("alice");
                seenOne += list == one;
                seenOther += list == other;
                refused += list != one && list != other;
            }
        });
    }
    for (long i = 0; i < ROUNDS || seenOne < ROUNDS || seenOther < ROUNDS; ++i)
        map.Load(dir.File(i % 2 == 0 ? "other" : "one"));
    done = true;
    for (auto& reader : readers)
        reader.join();
    EXPECT_EQ(refused, 0);
}

// Two refreshes at once: the one that reads later wins, whoever of them is faster.
TEST_F(oxxProfileMapTest, LastChangeOfAFileIsNotLost) {
    Profile("sales.wlp", "user0");
    Load();
    std::atomic<bool> done{false};
    std::thread other([&] {
        while (!done)
            map.Refresh("sales.wlp");
    });
    for (int i = 1; i <= 300; ++i) {
        const std::string user = "user" + std::to_string(i);
        Profile("next", user);
        std::filesystem::rename(dir.File("next"), dir.File("sales.wlp"));
        map.Refresh("sales.wlp");
        ASSERT_TRUE(map.IsPermitted(user, "sales.wlp")) << i;
    }
    done = true;
    other.join();
}
