#include "platform/directory.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <thread>

#include "platform/support_tempdir.h"

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
    const TempDir directory;
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
    const TempDir directory;
    directory.Write("file", "");
    oxDirIterator missing(directory / "missing", "*");
    EXPECT_FALSE(missing.IsValid());
    EXPECT_EQ(ENOENT, missing.Error());
    EXPECT_EQ(nullptr, missing.Next());
    const oxDirIterator file(directory / "file", "*");
    EXPECT_EQ(ENOTDIR, file.Error());
}

TEST(CreateDir, MakesTheDirectoriesAboveToo) {
    const mode_t mask = umask(0);
    const TempDir directory;
    EXPECT_TRUE(CreateDir(directory / "a/b//c/", PRIVATE_DIRECTORY_MODE));
    umask(mask);
    EXPECT_EQ(DIRECTORY_MODE, ModeOf(directory / "a"));
    EXPECT_EQ(DIRECTORY_MODE, ModeOf(directory / "a/b"));
    EXPECT_EQ(PRIVATE_DIRECTORY_MODE, ModeOf(directory / "a/b/c"));
    EXPECT_TRUE(CreateDir(directory / "a/b/c")) << "an existing one is success";
    EXPECT_EQ(PRIVATE_DIRECTORY_MODE, ModeOf(directory / "a/b/c")) << "and is left as it is";
}

TEST(CreateDir, TakesRelativeNamesAndTheRoot) {
    const TempDir directory;
    const WorkIn work(directory.Path());
    EXPECT_TRUE(CreateDir("./x/y"));
    EXPECT_TRUE(CreateDir("z"));
    EXPECT_TRUE(CreateDir("."));
    EXPECT_TRUE(CreateDir("/"));
    EXPECT_TRUE(std::filesystem::is_directory(directory / "x/y"));
    EXPECT_TRUE(std::filesystem::is_directory(directory / "z"));
}

TEST(CreateDir, TakesALinkToADirectory) {
    const TempDir directory;
    ASSERT_TRUE(CreateDir(directory / "real"));
    std::filesystem::create_symlink("real", directory / "link");
    EXPECT_TRUE(CreateDir(directory / "link"));
    EXPECT_TRUE(CreateDir(directory / "link/below"));
    EXPECT_TRUE(std::filesystem::is_directory(directory / "real/below"));
}

TEST(CreateDir, FailsWithErrno) {
    const TempDir directory;
    directory.Write("file", "");
    EXPECT_FALSE(CreateDir(directory / "file"));
    EXPECT_EQ(ENOTDIR, errno);
    EXPECT_FALSE(CreateDir(directory / "file/below"));
    EXPECT_EQ(ENOTDIR, errno);
    EXPECT_FALSE(CreateDir(""));
    EXPECT_EQ(ENOENT, errno);
    EXPECT_FALSE(CreateDir(directory / std::string(300, 'n')));
    EXPECT_EQ(ENAMETOOLONG, errno);
}

TEST(CreateDir, MayRunTwiceAtTheSameTime) {
    const TempDir directory;
    for (int round = 0; round < 50; ++round) {
        const std::string path = directory / (std::to_string(round) + "/a/b/c");
        bool first = false;
        bool second = false;
        std::thread other([&] { first = CreateDir(path); });
        second = CreateDir(path);
        other.join();
        ASSERT_TRUE(first && second);
    }
}

TEST(GetFullDirectoryName, ResolvesWhatExists) {
    const TempDir directory;
    const std::string real = std::filesystem::canonical(directory.Path());
    ASSERT_TRUE(CreateDir(directory / "real/sub"));
    std::filesystem::create_symlink("real", directory / "link");
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
        {directory / "link", real + "/real"},
        {"/", "/"},
    };
    for (const Case& c : cases) {
        std::string full;
        EXPECT_TRUE(GetFullDirectoryName(c.name, full)) << c.name;
        EXPECT_EQ(c.full, full) << c.name;
    }
}

TEST(GetFullDirectoryName, JoinsWhatDoesNotExist) {
    const TempDir directory;
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
    const TempDir directory;
    ASSERT_TRUE(CreateDir(directory / "gone"));
    const WorkIn work(directory / "gone");
    std::filesystem::remove(directory / "gone");
    std::string full;
    EXPECT_FALSE(GetFullDirectoryName("x", full));
    EXPECT_EQ(ENOENT, errno);
}
