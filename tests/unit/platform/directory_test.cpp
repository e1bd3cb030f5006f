#include "platform/directory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <thread>

#include "testing/scratch.h"

namespace {

using Names = std::vector<std::string>;

Names NamesIn(const std::string& directory, const std::string& pattern) {
    oxDirIterator iterator(directory, pattern);
    EXPECT_TRUE(iterator.IsValid());
    Names names;
    while (const std::string* name = iterator.Next())
        names.push_back(*name);
    EXPECT_EQ(nullptr, iterator.Next());
    return names;
}

mode_t ModeOf(const std::string& path) {
    struct stat status {};
    return stat(path.c_str(), &status) == 0 ? status.st_mode & 07777 : 0;
}

class WorkIn {
public:
    explicit WorkIn(const std::string& directory) : m_before(std::filesystem::current_path()) {
        std::filesystem::current_path(directory);
    }
    ~WorkIn() { std::filesystem::current_path(m_before); }
    WorkIn(const WorkIn&) = delete;
    WorkIn& operator=(const WorkIn&) = delete;

private:
    std::filesystem::path m_before;
};

}  // namespace

TEST(oxDirIterator, ListsWhatMatchesInOneOrder) {
    const Scratch directory;
    for (const char* name : {"zoe.usr", "adam.usr", "Bob.usr", "x.usr~", ".hidden.usr", "usr", "a b.usr"})
        directory.Write(name, "");
    EXPECT_EQ((Names{"Bob.usr", "a b.usr", "adam.usr", "zoe.usr"}), NamesIn(directory.Path(), "*.usr"));
    EXPECT_EQ((Names{".hidden.usr"}), NamesIn(directory.Path(), ".*"));
    EXPECT_EQ((Names{"usr"}), NamesIn(directory.Path(), "usr"));
    EXPECT_EQ((Names{"zoe.usr"}), NamesIn(directory.Path(), "[y-z]*"));
    EXPECT_EQ(Names{}, NamesIn(directory.Path(), "*.wlp"));
    EXPECT_EQ(Names{}, NamesIn(directory.Path(), ""));
}

TEST(oxDirIterator, SaysWhyADirectoryCannotBeListed) {
    const Scratch directory;
    directory.Write("file", "");
    oxDirIterator missing(directory.File("missing"), "*");
    EXPECT_FALSE(missing.IsValid());
    EXPECT_EQ(ENOENT, missing.Error());
    EXPECT_EQ(nullptr, missing.Next());
    const oxDirIterator file(directory.File("file"), "*");
    EXPECT_EQ(ENOTDIR, file.Error());
}

TEST(CreateDir, MakesTheDirectoriesAboveToo) {
    const mode_t mask = umask(0);
    const Scratch directory;
    EXPECT_TRUE(CreateDir(directory.File("a/b//c/"), PRIVATE_DIRECTORY_MODE));
    umask(mask);
    EXPECT_EQ(DIRECTORY_MODE, ModeOf(directory.File("a")));
    EXPECT_EQ(DIRECTORY_MODE, ModeOf(directory.File("a/b")));
    EXPECT_EQ(PRIVATE_DIRECTORY_MODE, ModeOf(directory.File("a/b/c")));
    EXPECT_TRUE(CreateDir(directory.File("a/b/c"))) << "an existing one is success";
    EXPECT_EQ(PRIVATE_DIRECTORY_MODE, ModeOf(directory.File("a/b/c"))) << "and is left as it is";
}

TEST(CreateDir, TakesRelativeNamesAndTheRoot) {
    const Scratch directory;
    const WorkIn work(directory.Path());
    EXPECT_TRUE(CreateDir("./x/y"));
    EXPECT_TRUE(CreateDir("z"));
    EXPECT_TRUE(CreateDir("."));
    EXPECT_TRUE(CreateDir("/"));
    EXPECT_TRUE(std::filesystem::is_directory(directory.File("x/y")));
    EXPECT_TRUE(std::filesystem::is_directory(directory.File("z")));
}

TEST(CreateDir, TakesALinkToADirectory) {
    const Scratch directory;
    ASSERT_TRUE(CreateDir(directory.File("real")));
    std::filesystem::create_symlink("real", directory.File("link"));
    EXPECT_TRUE(CreateDir(directory.File("link")));
    EXPECT_TRUE(CreateDir(directory.File("link/below")));
    EXPECT_TRUE(std::filesystem::is_directory(directory.File("real/below")));
}

TEST(CreateDir, FailsWithErrno) {
    const Scratch directory;
    directory.Write("file", "");
    EXPECT_FALSE(CreateDir(directory.File("file")));
    EXPECT_EQ(ENOTDIR, errno);
    EXPECT_FALSE(CreateDir(directory.File("file/below")));
    EXPECT_EQ(ENOTDIR, errno);
    EXPECT_FALSE(CreateDir(""));
    EXPECT_EQ(ENOENT, errno);
    EXPECT_FALSE(CreateDir(directory.File(std::string(300, 'n'))));
    EXPECT_EQ(ENAMETOOLONG, errno);
}

TEST(CreateDir, MayRunTwiceAtTheSameTime) {
    const Scratch directory;
    for (int round = 0; round < 50; ++round) {
        const std::string path = directory.File(std::to_string(round) + "/a/b/c");
        bool first = false;
        bool second = false;
        std::thread other([&] { first = CreateDir(path); });
        second = CreateDir(path);
        other.join();
        ASSERT_TRUE(first && second);
    }
}

TEST(GetFullDirectoryName, ResolvesWhatExists) {
    const Scratch directory;
    const std::string real = std::filesystem::canonical(directory.Path());
    ASSERT_TRUE(CreateDir(directory.File("real/sub")));
    std::filesystem::create_symlink("real", directory.File("link"));
    const WorkIn work(directory.Path());
    struct Case {
        std::string name;
        std::string full;
    };
    const Case cases[] = {
        {".", real},
        {"./", real},
        {"real/", real + "/real"},
        {"link/sub", real + "/real/sub"},
        {"./real/../link", real + "/real"},
        {directory.File("link"), real + "/real"},
        {"/", "/"},
    };
    for (const Case& c : cases) {
        std::string full;
        EXPECT_TRUE(GetFullDirectoryName(c.name, full)) << c.name;
        EXPECT_EQ(c.full, full) << c.name;
    }
}

TEST(GetFullDirectoryName, JoinsWhatDoesNotExist) {
    const Scratch directory;
    const std::string real = std::filesystem::canonical(directory.Path());
    const WorkIn work(directory.Path());
    struct Case {
        std::string name;
        std::string full;
    };
    const Case cases[] = {
        {"", real},
        {"missing", real + "/missing"},
        {"./missing/x", real + "/missing/x"},
        {"../missing", real + "/../missing"},
        {"/missing/x", "/missing/x"},
    };
    for (const Case& c : cases) {
        std::string full;
        EXPECT_TRUE(GetFullDirectoryName(c.name, full)) << c.name;
        EXPECT_EQ(c.full, full) << c.name;
    }
}

TEST(GetFullDirectoryName, RefusesWhatIsTooLong) {
    std::string full;
    const std::string longest = "/" + std::string(MAX_PATH_BYTES - 2, 'x');
    EXPECT_TRUE(GetFullDirectoryName(longest, full));
    EXPECT_EQ(longest, full);
    EXPECT_FALSE(GetFullDirectoryName(longest + "x", full));
    EXPECT_EQ(ENAMETOOLONG, errno);
    EXPECT_EQ("", full);
    EXPECT_FALSE(GetFullDirectoryName(std::string(MAX_PATH_BYTES - 1, 'x'), full));
    EXPECT_EQ(ENAMETOOLONG, errno);
}

TEST(GetFullDirectoryName, FailsWithoutAWorkingDirectory) {
    const Scratch directory;
    ASSERT_TRUE(CreateDir(directory.File("gone")));
    const WorkIn work(directory.File("gone"));
    std::filesystem::remove(directory.File("gone"));
    std::string full;
    EXPECT_FALSE(GetFullDirectoryName("x", full));
    EXPECT_EQ(ENOENT, errno);
}
