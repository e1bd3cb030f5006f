#include "unix/commandline.h"

#include <gtest/gtest.h>

namespace {
using Texts = std::vector<std::string>;
using Pairs = std::map<std::string, std::string>;

bool Parse(oxCommandLine& line, const Texts& arguments) {
    std::vector<const char*> argv{"./ox_remote"};
    for (const auto& argument : arguments)
        argv.push_back(argument.c_str());
    argv.push_back(nullptr);
    return line.Parse(static_cast<int>(argv.size()) - 1, argv.data());
}

struct Row {
    Texts arguments;
    Texts switches;
    Texts plain;
    Pairs pairs;
};
}  // namespace

TEST(OxCommandLine, ArgumentsAreSortedByForm) {
    const std::string fill(78, 'x');
    const Row rows[] = {
        {{}, {}, {}, {}},
        {{"-start"}, {"start"}, {}, {}},
        {{"--stop"}, {"stop"}, {}, {}},
        {{"-stop-now"}, {"stop"}, {}, {}},
        {{"-"}, {}, {}, {}},
        {{"--"}, {}, {}, {}},
        {{"start"}, {}, {"start"}, {}},
        {{"a-b"}, {"a"}, {}, {}},
        {{"a=1-2"}, {"a=1"}, {}, {}},
        {{""}, {}, {""}, {}},
        {{"a=b"}, {}, {}, {{"a", "b"}}},
        {{"a:b"}, {}, {}, {{"a", "b"}}},
        {{"a=b=c"}, {}, {}, {{"a", "b"}}},
        {{"a="}, {}, {}, {{"a", ""}}},
        {{"=b"}, {}, {}, {{"b", ""}}},
        {{"=:"}, {}, {}, {}},
        {{"a=1", "a=2"}, {}, {}, {{"a", "2"}}},
        {{"-stop", "plain", "-start"}, {"stop", "start"}, {"plain"}, {}},
        // The 79th character still counts, the 80th does not.
        {{fill + "-"}, {fill}, {}, {}},
        {{fill + "y-"}, {}, {fill + "y"}, {}},
        {{fill + "yz"}, {}, {fill + "y"}, {}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(testing::PrintToString(row.arguments));
        oxCommandLine line;
        ASSERT_TRUE(Parse(line, row.arguments));
        EXPECT_EQ(line.Switches(), row.switches);
        EXPECT_EQ(line.PlainArguments(), row.plain);
        EXPECT_EQ(line.Pairs(), row.pairs);
        EXPECT_EQ(line.ArgumentCount(), static_cast<int>(row.arguments.size()) + 1);
    }
}

TEST(OxCommandLine, MissingProgramNameFails) {
    const char* none[] = {nullptr};
    oxCommandLine line;
    EXPECT_FALSE(line.Parse(0, none));
    EXPECT_FALSE(line.Parse(1, none));
    EXPECT_FALSE(line.Parse(0, nullptr));
}

TEST(OxCommandLine, FirstAndNextWalkTheSwitches) {
    oxCommandLine line;
    ASSERT_TRUE(Parse(line, {"-a", "b", "-c"}));
    for (int round = 0; round < 2; ++round) {
        const auto* option = line.First();
        ASSERT_NE(option, nullptr);
        EXPECT_EQ(*option, "a");
        option = line.Next();
        ASSERT_NE(option, nullptr);
        EXPECT_EQ(*option, "c");
        EXPECT_EQ(line.Next(), nullptr);
        EXPECT_EQ(line.Next(), nullptr);
    }
}

TEST(OxCommandLine, FindLooksInSwitchesAndPlainArguments) {
    oxCommandLine line;
    ASSERT_TRUE(Parse(line, {"-a", "b", "c=d"}));
    ASSERT_NE(line.Find("a"), nullptr);
    EXPECT_EQ(*line.Find("a"), "a");
    ASSERT_NE(line.Find("b"), nullptr);
    EXPECT_EQ(*line.Find("b"), "b");
    EXPECT_EQ(line.Find("c"), nullptr);
    EXPECT_EQ(line.Find("A"), nullptr);
}

TEST(OxCommandLine, KeepsTheProgramPathAndTheVector) {
    const char* argv[] = {"/opt/v1.2/srv.bin", "-x", nullptr};
    oxCommandLine line;
    ASSERT_TRUE(line.Parse(2, argv));
    EXPECT_EQ(line.ProgramPath().FileName(), "srv.bin");
    EXPECT_EQ(line.Arguments(), argv);
}
