#include "platform/filename.h"

#include <gtest/gtest.h>

TEST(oxFilename, TakesPathsApart) {
    struct Case {
        const char* path;
        const char* directory;
        const char* fileName;
        const char* name;
        const char* extension;
        const char* again;
    };
    constexpr Case CASES[] = {
        {"/opt/v1.2/ox_remote.bin", "/opt/v1.2", "ox_remote.bin", "ox_remote", "bin", "/opt/v1.2/ox_remote.bin"},
        {"/opt/v1.2/ox_remote", "/opt/v1.2", "ox_remote", "ox_remote", "", "/opt/v1.2/ox_remote"},
        {"ox_remote", "", "ox_remote", "ox_remote", "", "ox_remote"},
        {"./ox_remote", ".", "ox_remote", "ox_remote", "", "./ox_remote"},
        {"../d/x", "../d", "x", "x", "", "../d/x"},
        {"/x", "/", "x", "x", "", "/x"},
        {"//x", "/", "x", "x", "", "/x"},
        {"a//b", "a", "b", "b", "", "a/b"},
        {"a.tar.gz", "", "a.tar.gz", "a.tar", "gz", "a.tar.gz"},
        {".htm", "", ".htm", "", "htm", ".htm"},
        {"d/.htm", "d", ".htm", "", "htm", "d/.htm"},
        {"name.", "", "name.", "name", "", "name."},
        {"..", "", "..", ".", "", ".."},
        {".", "", ".", "", "", "."},
        {"dir/", "dir", "", "", "", "dir/"},
        {"/", "/", "", "", "", "/"},
        {"", "", "", "", "", ""},
    };
    for (const Case& c : CASES) {
        const oxFilename file{std::string_view(c.path)};
        EXPECT_EQ(c.directory, file.Directory()) << c.path;
        EXPECT_EQ(c.fileName, file.FileName()) << c.path;
        EXPECT_EQ(c.name, file.Name()) << c.path;
        EXPECT_EQ(c.extension, file.Extension()) << c.path;
        EXPECT_EQ(c.again, file.Path()) << c.path;
    }
}

TEST(oxFilename, IsBuiltOfDirectoryAndFileName) {
    const oxFilename file("/opt/product/", "ox_remote.pid");
    EXPECT_EQ("/opt/product", file.Directory());
    EXPECT_EQ("ox_remote", file.Name());
    EXPECT_EQ("pid", file.Extension());
    EXPECT_EQ("/opt/product/ox_remote.pid", file.Path());
    EXPECT_EQ("x", oxFilename("", "x").Path());
    EXPECT_EQ("", oxFilename().Path());
}

TEST(oxFilename, ChangesItsParts) {
    oxFilename file(std::string_view("./srv.bin"));
    file.SetExtension("pid");
    EXPECT_EQ("./srv.pid", file.Path());
    file.SetExtension("");
    EXPECT_EQ("./srv", file.Path());
    file.SetExtension("startup");
    file.SetDirectory("/home/x//");
    EXPECT_EQ("/home/x/srv.startup", file.Path());
    file.SetDirectory("/");
    EXPECT_EQ("/srv.startup", file.Path());
    EXPECT_EQ("/", file.Directory());
    file.SetDirectory("");
    EXPECT_EQ("srv.startup", file.Path());
}

TEST(oxFilename, JoinPutsOneSlashBetween) {
    struct Case {
        const char* directory;
        const char* name;
        const char* path;
    };
    constexpr Case CASES[] = {
        {"a", "b", "a/b"},         {"a/", "b", "a/b"}, {"a", "/b", "a/b"}, {"a//", "//b", "a/b"}, {"/", "b", "/b"},
        {"/", "/b", "/b"},         {"", "b", "b"},     {"", "/b", "/b"},   {"a", "", "a/"},       {"/", "", "/"},
        {".", "x.ini", "./x.ini"}, {"", "", ""},
    };
    for (const Case& c : CASES)
        EXPECT_EQ(c.path, oxFilename::Join(c.directory, c.name)) << c.directory << " " << c.name;
}

TEST(oxFilename, NormalizePath) {
    struct Case {
        const char* path;
        const char* normal;
    };
    constexpr Case CASES[] = {
        {"", ""},
        {"/", "/"},
        {"//", "/"},
        {".", "."},
        {"./", "."},
        {"./.", "."},
        {"/.", "/"},
        {"/./", "/"},
        {"a", "a"},
        {"a/", "a"},
        {"a//", "a"},
        {"a/.", "a"},
        {"a/./b", "a/b"},
        {"a//b", "a/b"},
        {"//a", "/a"},
        {"/./a", "/a"},
        {"./a", "./a"},
        {".//a", "./a"},
        {"././a", "./a"},
        {"./oxm_oxx/datfiles/statuslogs", "./oxm_oxx/datfiles/statuslogs"},
        {"./oxm_oxx//datfiles/./statuslogs/", "./oxm_oxx/datfiles/statuslogs"},
        {".\\logs\\x", "./logs/x"},
        {"a\\\\b", "a/b"},
        {"..", ".."},
        {"a/../b", "a/../b"},
        {"../a/..", "../a/.."},
        {"a/...", "a/..."},
        {"a/.b/c.", "a/.b/c."},
        {" a / b ", " a / b "},
    };
    for (const Case& c : CASES) {
        EXPECT_EQ(c.normal, oxFilename::NormalizePath(c.path)) << c.path;
        EXPECT_EQ(c.normal, oxFilename::NormalizePath(c.normal)) << "twice: " << c.path;
    }
}
