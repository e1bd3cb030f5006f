#include "unix/startupconfig.h"

#include <gtest/gtest.h>

#include "unix/testtools.h"

namespace {
constexpr const char* MAIN_FILE = "oxm_oxx/oxm_oxx.ini";

class OxStartupConfig : public testing::Test {
protected:
    void Write(const std::string& mainText, const std::string& serverText) {
        std::filesystem::create_directories("oxm_oxx");
        WriteText(MAIN_FILE, mainText);
        WriteText("ox_remote.ini", serverText);
    }
    bool Read() { return config.Read(audit, errors.File()); }

    ScratchDirectory scratch;
    LinesAudit audit;
    TextStream errors;
    oxStartupConfig config;
};
using Lines = std::vector<std::string>;
}  // namespace

TEST_F(OxStartupConfig, MissingKeysLeaveTheDefaults) {
    Write("", "");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.mainSettingsFile, "./oxm_oxx/oxm_oxx.ini");
    EXPECT_EQ(config.ersAddress, "9999");
    EXPECT_EQ(config.handles, -1);
    EXPECT_EQ(config.gid, 1);
    EXPECT_EQ(config.uid, 1);
    EXPECT_EQ(config.debugLevel, 1);
    EXPECT_EQ(config.logFile, "oxinterface.audit");
    EXPECT_EQ(config.logDir, "./oxm_oxx/datfiles/statuslogs");
    EXPECT_TRUE(audit.lines.empty());
    EXPECT_EQ(errors.Text(), "");
}

TEST_F(OxStartupConfig, ValuesAreReadAndPathsNormalised) {
    Write("[interface]\nersaddress=10.0.0.1:77//x\n",
          "[unix]\nhandles=500\ngid=7\nuid=65535\n[audit]\ndebuglevel=0\nlogfile=a//b.txt\nlogdir=./logs//now/\n");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.ersAddress, "10.0.0.1:77//x");
    EXPECT_EQ(config.handles, 500);
    EXPECT_EQ(config.gid, 7);
    EXPECT_EQ(config.uid, 65535);
    EXPECT_EQ(config.debugLevel, 0);
    EXPECT_EQ(config.logFile, "a/b.txt");
    EXPECT_EQ(config.logDir, "./logs/now");
}

TEST_F(OxStartupConfig, ThePathOfTheMainFileIsNoSettingOfEitherFile) {
    Write("[oxm_oxx]\nconfigfile=elsewhere.ini\n", "[oxm_oxx]\nconfigfile=elsewhere.ini\n");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.mainSettingsFile, "./oxm_oxx/oxm_oxx.ini");
}

TEST_F(OxStartupConfig, TextsAreCut) {
    Write("[interface]\nersaddress=" + std::string(5000, 'x') + "\n", "");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.ersAddress, std::string(4095, 'x'));
}

TEST_F(OxStartupConfig, PathsAreCutBeforeTheyAreNormalised) {
    const std::string tail(5000, 'x');
    Write("", "[Audit]\nlogfile=a//" + tail + "\nlogdir=./b//" + tail + "\n");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.logFile, "a/" + std::string(4095 - 3, 'x'));
    EXPECT_EQ(config.logDir, "./b/" + std::string(4095 - 5, 'x'));
}

TEST_F(OxStartupConfig, ASecondReadingStartsFromTheFirst) {
    Write("", "[Audit]\ndebuglevel=9\nlogfile=mine\n");
    ASSERT_TRUE(Read());
    Write("", "");
    ASSERT_TRUE(Read());
    EXPECT_EQ(config.debugLevel, 9);
    EXPECT_EQ(config.logFile, "mine");
}

TEST_F(OxStartupConfig, AMissingFileFailsWithALine) {
    EXPECT_FALSE(Read());
    EXPECT_EQ(audit.lines, Lines{"Warning: config file does not exist: ./oxm_oxx/oxm_oxx.ini."});
    audit.lines.clear();
    Write("", "");
    std::filesystem::remove("ox_remote.ini");
    EXPECT_FALSE(Read());
    EXPECT_EQ(audit.lines, Lines{"Warning: config file does not exist: ./ox_remote.ini."});
    EXPECT_EQ(errors.Text(), "");
}

TEST_F(OxStartupConfig, BothFilesMustExistBeforeEitherIsLoaded) {
    std::filesystem::create_directories(MAIN_FILE);  // would not load
    EXPECT_FALSE(Read());
    EXPECT_EQ(audit.lines, Lines{"Warning: config file does not exist: ./ox_remote.ini."});
    EXPECT_EQ(errors.Text(), "");
}

TEST_F(OxStartupConfig, AFileThatDoesNotLoadFailsWithTwoLines) {
    Write("", "");
    std::filesystem::remove("ox_remote.ini");
    std::filesystem::create_directory("ox_remote.ini");
    EXPECT_FALSE(Read());
    EXPECT_EQ(audit.lines, Lines{"Failed to parse config file - ./ox_remote.ini."});
    EXPECT_EQ(errors.Text(), "Exception caught in ./ox_remote_exe/src/unix/xmain at ln. 607: ./ox_remote.ini\n");
    EXPECT_EQ(config.debugLevel, 1);
}

TEST_F(OxStartupConfig, ANulByteInTheMainFileFails) {
    Write(std::string("[interface]\n\0", 13), "");
    EXPECT_FALSE(Read());
    EXPECT_EQ(errors.Text(), "Exception caught in ./ox_remote_exe/src/unix/xmain at ln. 607: ./oxm_oxx/oxm_oxx.ini\n");
}
