#include <gtest/gtest.h>

#include <memory>
#include <string>

#include "protocol/nomemory.h"
#include "protocol/reply.h"

using namespace std::string_literals;

namespace {

// The declared type of a page, which lies in memory of exactly its size.
std::string Scan(const std::string& page) {
    const auto exact = std::make_unique<char[]>(page.size());
    page.copy(exact.get(), page.size());
    oxReply reply(Http::OK_200);
    reply.ScanForMetaTags(exact.get(), page.size());
    return reply.GetContentTypeOverride();
}

std::string Head(const std::string& text) {
    return "<html><head>" + text + "</head><body></body></html>";
}

const std::string TAG = R"(<meta http-equiv="Content-Type" content="text/html; charset=UTF-8">)";
const std::string TYPE = "text/html; charset=utf-8";

TEST(MetaTag, Table) {
    const struct {
        const char* name;
        std::string page;
        std::string expected;
    } cases[] = {
        {"declared", Head(TAG), TYPE},
        {"all upper case", R"(<HTML><HEAD><META HTTP-EQUIV="CONTENT-TYPE" CONTENT="A/B"></HEAD>)", "a/b"},
        {"nothing", "", ""},
        {"no head", TAG, ""},
        {"head not ended", "<head>" + TAG, ""},
        {"head ended before", "</head>" + TAG + "<head>", ""},
        {"head with attributes", "<head lang=en>" + TAG + "</head>", ""},
        {"only the first head", "<head></head><head>" + TAG + "</head>", ""},
        {"in the body", "<head></head><body>" + TAG + "</body>", ""},
        {"mixed case head", "<HeAd>" + TAG + "</hEaD>", TYPE},
        {"head in head", "<head><head>" + TAG + "</head>", TYPE},
        {"blanks everywhere", Head("< \tmeta \thttp-equiv \t= \t\" \tContent-Type\" \tcontent \t= \t\" \ta/b\" >"),
         "a/b"},
        {"no blanks", Head(R"(<metahttp-equiv="Content-Type"content="a/b">)"), "a/b"},
        {"line break is no blank", Head("<meta\nhttp-equiv=\"Content-Type\" content=\"a/b\">"), ""},
        {"line break before content", Head("<meta http-equiv=\"Content-Type\"\ncontent=\"a/b\">"), ""},
        {"trailing blanks stay", Head(R"(<meta http-equiv="Content-Type" content="a/b ">)"), "a/b "},
        {"no quotes", Head("<meta http-equiv=Content-Type content=a/b>"), ""},
        {"single quotes", Head("<meta http-equiv='Content-Type' content='a/b'>"), ""},
        {"no quotes around value", Head(R"(<meta http-equiv="Content-Type" content=a/b>)"), ""},
        {"other order", Head(R"(<meta content="a/b" http-equiv="Content-Type">)"), ""},
        {"other name", Head(R"(<meta http-equiv="Refresh" content="5">)"), ""},
        {"name runs on", Head(R"(<meta http-equiv="Content-Type-Other" content="a/b">)"), "a/b"},
        {"name too short", Head(R"(<meta http-equiv="Content-Typ" content="a/b">)"), ""},
        {"name not ended", Head(R"(<meta http-equiv="Content-Type content=a/b>)"), ""},
        {"value not ended", Head(R"(<meta http-equiv="Content-Type" content="a/b>)"), ""},
        {"value empty", Head(TAG + R"(<meta http-equiv="Content-Type" content="">)"), ""},
        {"value holds the end of a tag", Head(R"(<meta http-equiv="Content-Type" content="a>b">)"), "a>b"},
        {"value runs on to the next quote",
         Head(R"(<meta http-equiv="content-type" content="a>< meta http-equiv="content-type" content="c/d">)"),
         "a>< meta http-equiv="},
        {"later one wins", Head(TAG + R"(<meta http-equiv="Content-Type" content="a/b">)"), "a/b"},
        {"later broken one does not", Head(TAG + R"(<meta http-equiv="Content-Type" content=")"), TYPE},
        {"behind other tags", Head("<title>x</title><meta name=\"a\" content=\"b\">" + TAG), TYPE},
        {"behind a bare bracket", Head("< <" + TAG), TYPE},
        {"behind a broken one", Head("<meta http-equiv=" + TAG), TYPE},
        {"swallowed by a name not ended", Head("<meta http-equiv=\"x>" + TAG), ""},
        {"skipped as part of another tag", Head("<meta name=" + TAG), ""},
        {"in a comment", Head("<!-- " + TAG + " -->"), TYPE},
        {"longer word", Head(R"(<metadata http-equiv="Content-Type" content="a/b">)"), ""},
        {"closing tag", Head(R"(</meta http-equiv="Content-Type" content="a/b">)"), ""},
        {"behind a NUL", Head("\0"s + TAG), ""},
        {"NUL in the value", Head("<meta http-equiv=\"Content-Type\" content=\"a\0b\">"s), ""},
        {"bytes above ASCII", Head("<meta http-equiv=\"Content-Type\" content=\"\xc4\xff\">"), "\xc4\xff"},
        {"control characters", Head("<meta http-equiv=\"Content-Type\" content=\"a\r\nB: c\td\x7f\x01\">"),
         "a  b: c d  "},
    };
    for (const auto& c : cases)
        EXPECT_EQ(c.expected, Scan(c.page)) << c.name;
}

// Every beginning of a page, so that the text ends at every place of the scan.
TEST(MetaTag, EveryBeginning) {
    const std::string page =
        Head("<title></title><meta http-equiv = \"Refresh\" content = \"5\" >" + TAG + TAG) + "<p>";
    const std::size_t complete = page.find("</head>") + 7;
    for (std::size_t length = 0; length <= page.size(); ++length)
        EXPECT_EQ(length < complete ? "" : TYPE, Scan(page.substr(0, length))) << length;
    // The same with the head ended behind every beginning.
    const std::size_t first = page.find(TAG);
    for (std::size_t length = 12; length < complete - 7; ++length)
        EXPECT_EQ(length < first + TAG.size() - 1 ? "" : TYPE, Scan(page.substr(0, length) + "</head>")) << length;
}

TEST(MetaTag, Only2000BytesAreScanned) {
    const std::string page = Head(TAG);
    const std::size_t used = page.find("</head>") + 7;
    EXPECT_EQ(TYPE, Scan(std::string(2000 - used, ' ') + page));
    EXPECT_EQ("", Scan(std::string(2001 - used, ' ') + page));
    EXPECT_EQ("", Scan("<head>" + std::string(2000, ' ') + TAG + "</head>"));
}

TEST(MetaTag, HeadOfAnyLengthNeedsNoMemory) {
    const std::string page =
        "<head>" + std::string(1900, ' ') + R"(<meta http-equiv="Content-Type" content="A/B">)" + "</head>";
    ASSERT_LE(page.size(), 2000u);
    oxReply reply(Http::OK_200);
    {
        const NoMemory none;
        reply.ScanForMetaTags(page.data(), page.size());
    }
    EXPECT_EQ("a/b", reply.GetContentTypeOverride());
}

TEST(MetaTag, EmptyTypeStandsForTheFilesOwn) {
    oxReply reply(Http::OK_200, Http::TYPE_HTML, -1, 0, nullptr);
    const std::string page = Head(R"(<meta http-equiv="Content-Type" content="">)");
    reply.ScanForMetaTags(page.data(), page.size());
    EXPECT_NE(std::string::npos, reply.ComposeHeader().find("\r\nContent-Type: text/html\r\n"));
    const std::string other = Head(TAG);
    reply.ScanForMetaTags(other.data(), other.size());
    EXPECT_NE(std::string::npos, reply.ComposeHeader().find("\r\nContent-Type: text/html; charset=utf-8\r\n"));
}

}  // namespace
