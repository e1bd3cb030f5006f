#include "platform/config.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <climits>
#include <thread>

#include "testing/ordinaryuser.h"
#include "testing/scratch.h"

using namespace std::string_literals;
using namespace std::string_view_literals;

namespace {

constexpr const char* MISSING = "(missing)";

struct TextCase {
    const char* rule;
    std::string_view file;
    const char* value;  // of key "k" in section "s"
};

std::string ValueIn(std::string_view file) {
    oxConfig config;
    EXPECT_TRUE(config.OpenText(file));
    return config.GetText("s", "k", MISSING);
}

}  // namespace

TEST(oxConfig, ReadingRules) {
    constexpr TextCase CASES[] = {
        {"a plain line", "[s]\nk=v\n", "v"},
        {"no line end at the end", "[s]\nk=v", "v"},
        {"sections without regard to case", "[S]\nk=v\n", "v"},
        {"keys without regard to case", "[s]\nK=v\n", "v"},
        {"spaces around the key", "[s]\n \tk \t=v\n", "v"},
        {"spaces around the value", "[s]\nk= \tv w\t \n", "v w"},
        {"spaces around the section", "  [ s ] \nk=v\n", "v"},
        {"text behind a section's name", "[s] more\nk=v\n", "v"},
        {"an empty value", "[s]\nk=\n", ""},
        {"an empty value at the end", "[s]\nk=", ""},
        {"a value of spaces", "[s]\nk=   \nx=y\n", ""},
        {"CR LF", "[s]\r\nk=v\r\nx=y\r\n", "v"},
        {"a byte order mark", "\xEF\xBB\xBF[s]\nk=v\n", "v"},
        {"a byte order mark and CR LF", "\xEF\xBB\xBF[s]\r\nk=v\r\n", "v"},
        {"; begins a comment line", "[s]\n;k=v\n", MISSING},
        {"# begins a comment line", "[s]\n#k=v\n", MISSING},
        {"a comment line after spaces", "[s]\n  ;k=v\n", MISSING},
        {"a value is read after comments", "; a\n\n# b\n[s]\n; c\n\n# d\nk=v\n", "v"},
        {"; in a value stays", "[s]\nk=a;b ; c\n", "a;b ; c"},
        {"# in a value stays", "[s]\nk=a#b # c\n", "a#b # c"},
        {"a value may begin with ;", "[s]\nk=;v\n", ";v"},
        {"= in a value stays", "[s]\nk=a=b==\n", "a=b=="},
        {"quotes stay", "[s]\nk=\"v\"\n", "\"v\""},
        {"a backslash continues nothing", "[s]\nk=a\\\nx=b\n", "a\\"},
        {"no values of several lines", "[s]\nk=<<<END\nx=b\nEND\n", "<<<END"},
        {"the last of equal keys counts", "[s]\nk=1\nk=2\nK=3\n", "3"},
        {"the last counts, empty too", "[s]\nk=1\nk=\n", ""},
        {"equal sections are one", "[s]\nk=1\n[t]\nk=2\n[S]\nk=3\n", "3"},
        {"a key of the earlier equal section", "[s]\nk=1\n[t]\nk=2\n[s]\nx=3\n", "1"},
        {"text before the first section is ignored", "k=0\nhello\n[s]\nx=1\n", MISSING},
        {"another section's key", "[t]\nk=v\n[s]\nx=1\n", MISSING},
        {"a line without = is ignored", "[s]\nhello\nk=v\n", "v"},
        {"a key without = is none", "[s]\nk\n", MISSING},
        {"a line that begins with = is ignored", "[s]\n=x\nk=v\n", "v"},
        {"an unclosed section name is ignored", "[s]\n[t\nk=v\n", "v"},
        {"an unclosed section name at the end", "[s]\nk=v\n[t", "v"},
        {"a section without a name", "[]\nk=v\n", MISSING},
        {"bytes above 127", "[s]\nk=\xE4\xC3\xA4\n", "\xE4\xC3\xA4"},
        {"an empty file", "", MISSING},
        {"comments only", "; a\n\n# b", MISSING},
        {"blank lines only", "\n \r\n\n", MISSING},
    };
    for (const TextCase& c : CASES)
        EXPECT_EQ(c.value, ValueIn(c.file)) << c.rule;
}

TEST(oxConfig, ValuesMayBeOfAnyLength) {
    const std::string longValue(100000, 'v');
    EXPECT_EQ(longValue, ValueIn("[s]\nk=" + longValue + "\n"));
}

TEST(oxConfig, LooksUpWithoutRegardToCase) {
    oxConfig config;
    ASSERT_TRUE(config.OpenText("[RemoteConfiguration]\nWebPort=81\n"));
    EXPECT_EQ(81, config.GetInt("remoteconfiguration", "WEBPORT", 80));
    EXPECT_TRUE(config.HasKey("REMOTECONFIGURATION", "webport"));
    EXPECT_TRUE(config.HasSection("remoteConfiguration"));
    EXPECT_FALSE(config.HasKey("RemoteConfiguration", "WebAddress"));
    EXPECT_FALSE(config.HasSection("RemoteConfig"));
}

TEST(oxConfig, TextBeforeTheFirstSectionCannotBeAskedFor) {
    oxConfig config;
    ASSERT_TRUE(config.OpenText("k=1\n[]\nk=2\n"));
    EXPECT_EQ("d", config.GetText("", "k", "d"));
    EXPECT_FALSE(config.HasKey("", "k"));
    EXPECT_FALSE(config.HasSection(""));
    EXPECT_FALSE(config.PutText("", "k", "3"));
}

TEST(oxConfig, Integers) {
    struct Case {
        const char* text;
        int value;
    };
    constexpr int DEFAULT = -77;
    constexpr Case CASES[] = {
        {"0", 0},
        {"80", 80},
        {"+80", 80},
        {"-80", -80},
        {"010", 10},
        {"0x1F", 31},
        {"0Xff", 255},
        {"-0x10", -16},
        {" 7 ", 7},
        {"2147483647", INT_MAX},
        {"2147483648", INT_MAX},
        {"-2147483648", INT_MIN},
        {"-2147483649", INT_MIN},
        {"99999999999999999999999999", INT_MAX},
        {"-99999999999999999999999999", INT_MIN},
        {"0xFFFFFFFFFFFFFFFFFF", INT_MAX},
        {"", DEFAULT},
        {"text", DEFAULT},
        {"12x", DEFAULT},
        {"1 2", DEFAULT},
        {"1.5", DEFAULT},
        {"+", DEFAULT},
        {"-", DEFAULT},
        {"--1", DEFAULT},
        {"+-1", DEFAULT},
        {"- 1", DEFAULT},
        {"0x", DEFAULT},
        {"0x-1", DEFAULT},
        {"0x0x1", DEFAULT},
        {"1F", DEFAULT},
        {"99999999999999999999999999x", DEFAULT},
    };
    for (const Case& c : CASES) {
        oxConfig config;
        ASSERT_TRUE(config.OpenText("[s]\nk=" + std::string(c.text) + "\n"));
        EXPECT_EQ(c.value, config.GetInt("s", "k", DEFAULT)) << c.text;
        EXPECT_EQ(DEFAULT, config.GetInt("s", "other", DEFAULT));
    }
}

TEST(oxConfig, Switches) {
    struct Case {
        const char* text;
        bool value;
    };
    constexpr Case CASES[] = {
        {"1", true},     {"2", true},  {"-1", true},  {"0x1", true},    {"99999999999", true}, {"yes", true},
        {"YES", true},   {"on", true}, {"On", true},  {"true", true},   {"True", true},        {" yes ", true},
        {"0", false},    {"", false},  {"no", false}, {"off", false},   {"false", false},      {"y", false},
        {"yess", false}, {"t", false}, {"00", false}, {"1 yes", false}, {"0x0", false},
    };
    for (const Case& c : CASES) {
        oxConfig config;
        ASSERT_TRUE(config.OpenText("[s]\nk=" + std::string(c.text) + "\n"));
        EXPECT_EQ(c.value, config.GetBool("s", "k", !c.value)) << c.text;
    }
    oxConfig config;
    EXPECT_TRUE(config.GetBool("s", "k", true));
    EXPECT_FALSE(config.GetBool("s", "k", false));
}

TEST(oxConfig, AnObjectThatWasNotLoadedHasNoKeys) {
    oxConfig config;
    EXPECT_FALSE(config.IsOpen());
    EXPECT_EQ("", config.Path());
    EXPECT_EQ("", config.ErrorText());
    EXPECT_EQ("./oxm_oxx/oxm_oxx.ini", config.GetText("oxm_oxx", "configfile", "./oxm_oxx/oxm_oxx.ini"));
    EXPECT_EQ(5, config.GetInt("s", "k", 5));
    EXPECT_FALSE(config.HasKey("s", "k"));
    EXPECT_FALSE(config.HasSection("s"));
    EXPECT_EQ("", config.Text());
    config.Remove("s", "k");
    config.Close();
}

TEST(oxConfig, OpensFilesAndSaysWhyNot) {
    const Scratch directory;
    directory.Write("good.ini", "[s]\nk=v\n");
    directory.Write("nul.ini", "[s]\nk=v\n\0"s);
    directory.Write("empty.ini", "");
    ASSERT_EQ(0, mkfifo(directory.File("pipe.ini").c_str(), 0600));
    struct Case {
        std::string path;
        const char* error;
    };
    const Case cases[] = {
        {directory.File("missing.ini"), "No such file or directory"},
        {directory.Path(), "Is a directory"},
        {directory.File("nul.ini"), "The file holds a NUL byte"},
        {directory.File("pipe.ini"), "Invalid argument"},
        {directory.File("good.ini/x"), "Not a directory"},
    };
    oxConfig config;
    for (const Case& c : cases) {
        EXPECT_TRUE(config.Open(directory.File("good.ini")));
        EXPECT_TRUE(config.IsOpen());
        EXPECT_EQ(directory.File("good.ini"), config.Path());
        EXPECT_EQ("", config.ErrorText());
        EXPECT_EQ("v", config.GetText("s", "k", ""));
        EXPECT_FALSE(config.Open(c.path));
        EXPECT_FALSE(config.IsOpen());
        EXPECT_EQ(c.path, config.Path());
        EXPECT_EQ(c.error, config.ErrorText());
        EXPECT_FALSE(config.HasKey("s", "k")) << "nothing of the earlier file is left";
    }
    EXPECT_TRUE(config.Open(directory.File("empty.ini")));
}

TEST(oxConfig, FileWithoutPermissionDoesNotLoad) {
    const Scratch directory;
    directory.Write("closed.ini", "[s]\nk=v\n");
    ASSERT_EQ(0, chmod((directory.File("closed.ini")).c_str(), 0));
    AsOrdinaryUser([&] {
        oxConfig config;
        EXPECT_FALSE(config.Open(directory.File("closed.ini")));
        EXPECT_FALSE(config.IsOpen());
        EXPECT_EQ("Permission denied", config.ErrorText());
    });
}

TEST(oxConfig, PutsAndRemoves) {
    oxConfig config;
    EXPECT_TRUE(config.PutText("UserInfo", "username", "alice"));
    EXPECT_TRUE(config.PutInt("UserInfo", "permissions", -3));
    EXPECT_EQ("alice", config.GetText("userinfo", "UserName", ""));
    EXPECT_EQ(-3, config.GetInt("UserInfo", "permissions", 0));
    EXPECT_EQ("[UserInfo]\nusername=alice\npermissions=-3\n", config.Text());
    EXPECT_TRUE(config.PutText("USERINFO", "USERNAME", " bob \t"));
    EXPECT_EQ("bob", config.GetText("UserInfo", "username", ""));
    config.Remove("userinfo", "PERMISSIONS");
    config.Remove("userinfo", "none");
    config.Remove("none", "none");
    EXPECT_EQ("[UserInfo]\nusername=bob\n", config.Text());
}

TEST(oxConfig, RefusesWhatWouldNotBeReadBack) {
    oxConfig config;
    for (const std::string_view value : {"a\nb"sv, "a\rb"sv, "a\0b"sv, "\n"sv, "a\n"sv})
        EXPECT_FALSE(config.PutText("s", "k", std::string(value))) << value;
    for (const char* key : {"", "a=b", ";a", "#a", "[a", " a", "a ", "a\nb"})
        EXPECT_FALSE(config.PutText("s", key, "v")) << key;
    for (const char* section : {"", "a]b", " a", "a\nb"})
        EXPECT_FALSE(config.PutText(section, "k", "v")) << section;
    EXPECT_EQ("", config.Text());
}

TEST(oxConfig, WrittenValuesAreReadBack) {
    for (const char* value : {"", "v", "a;b#c", ";v", "[x]", "a=b", "\"q\"", "<<<END", "\\", "\xE4", "a \t b"}) {
        oxConfig config;
        ASSERT_TRUE(config.PutText("s", "k", value));
        EXPECT_EQ(value, ValueIn(config.Text()));
    }
}

TEST(oxConfig, WritingKeepsCommentsUnknownKeysAndOrder) {
    oxConfig config;
    ASSERT_TRUE(
        config.OpenText("\xEF\xBB\xBF# head\r\n\r\n; section\r\n[B]\r\nz = 1\r\n; about k\r\n# more\r\nK=old\r\n"
                        "junk\r\na=2\r\n[A]\r\nx=3\r\n; the end\r\n"));
    ASSERT_TRUE(config.PutText("b", "k", "new"));
    ASSERT_TRUE(config.PutText("A", "y", "4"));
    const std::string text = config.Text();
    EXPECT_EQ(
        "# head\n\n\n; section\n[B]\nz=1\n\n; about k\n# more\nK=new\n\n;junk\na=2\n\n\n[A]\nx=3\ny=4\n\n; the end\n",
        text);
    oxConfig again;
    ASSERT_TRUE(again.OpenText(text));
    EXPECT_EQ(text, again.Text()) << "writing twice changes nothing";
}

TEST(oxConfig, CommentsOfAFileWithoutEntriesStayAtItsHead) {
    oxConfig config;
    ASSERT_TRUE(config.OpenText("; only\n\n; comments"));
    EXPECT_EQ("; only\n\n; comments\n", config.Text());
    ASSERT_TRUE(config.PutText("s", "k", "v"));
    EXPECT_EQ("; only\n\n; comments\n\n[s]\nk=v\n", config.Text());
}

TEST(oxConfig, MovesWithItsContent) {
    oxConfig first;
    ASSERT_TRUE(first.OpenText("[s]\nk=v\n"));
    oxConfig second(std::move(first));
    EXPECT_EQ("v", second.GetText("s", "k", ""));
    oxConfig third;
    third = std::move(second);
    EXPECT_TRUE(third.IsOpen());
    EXPECT_EQ("v", third.GetText("s", "k", ""));
    third.Close();
    EXPECT_FALSE(third.IsOpen());
    EXPECT_EQ("d", third.GetText("s", "k", "d"));
}
