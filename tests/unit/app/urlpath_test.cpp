#include "app/urlpath.h"

#include <gtest/gtest.h>

#include <string>

TEST(OxUrlPath, Climbs) {
    const struct {
        const char* path;
        bool climbs;
    } CASES[] = {{"/", false},    {"/../a", true}, {"/a/../b.html", true}, {"/a../b", true}, {"/..", false},
                 {"/a..", false}, {"/.../", true}, {"../", true},          {"", false},      {"/a/./b", false}};
    for (const auto& c : CASES)
        EXPECT_EQ(oxUrlPath(c.path).Climbs(), c.climbs) << c.path;
}

TEST(OxUrlPath, FirstComponent) {
    const struct {
        const char* path;
        bool reports;
    } CASES[] = {{"/reports", true},
                 {"/reports/", true},
                 {"/reports/P/x.htm", true},
                 {"/reports.htm", false},
                 {"/reportsX/a", false},
                 {"/Reports/a", false},
                 {"//reports/a", false},
                 {"reports/a", false},
                 {"/report", false},
                 {"/a/reports", false},
                 {"", false},
                 {"/reports//", true}};
    for (const auto& c : CASES)
        EXPECT_EQ(oxUrlPath(c.path).BeginsWith("reports"), c.reports) << c.path;
}

TEST(OxUrlPath, ProfileIsWhatStandsBehindTheSecondSlash) {
    const struct {
        const char* path;
        const char* profile;
        const char* behindFirst;
        bool below;
    } CASES[] = {{"/reports", "", "", false},
                 {"/reports/", "", "/", true},
                 {"/reports/P", "P", "/P", true},
                 {"/reports/P/", "P", "/P/", true},
                 {"/reports/P/x/y.htm", "P", "/P/x/y.htm", true},
                 {"/reports//P/x.htm", "", "//P/x.htm", true},
                 {"/reports/a.wlp/x", "a.wlp", "/a.wlp/x", true},
                 {"//a", "a", "/a", true},
                 {"/", "", "", false},
                 {"", "", "", false},
                 {"/x.htm", "", "", false}};
    for (const auto& c : CASES) {
        EXPECT_EQ(oxUrlPath(c.path).Profile(), c.profile) << c.path;
        EXPECT_EQ(oxUrlPath(c.path).BehindFirst(), c.behindFirst) << c.path;
        EXPECT_EQ(oxUrlPath(c.path).IsBelowTop(), c.below) << c.path;
    }
}

TEST(OxUrlPath, BlanksAndControlCharactersDoNotFitACommandLine) {
    for (const char c : {' ', '\t', '\n', '\r', '\v', '\x01', '\x1f', '\x7f'})
        EXPECT_FALSE(oxUrlPath(std::string("/a") + c + "b.pl").FitsCommandLine()) << static_cast<int>(c);
    for (const char* path : {"/a.pl", "/a/b+c.pl", "/\xc3\xa4.pl", "/a\"b'$.pl", ""})
        EXPECT_TRUE(oxUrlPath(path).FitsCommandLine()) << path;
}
