#include "resources/script.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "protocol/testsockets.h"
#include "testing/engine.h"
#include "testing/manualclock.h"
#include "testing/waiting.h"

namespace {

const char* Echo(void* context, const char* contextString, int command, char* argumentText, int* status) {
    thread_local std::string text;
    text = std::to_string(command) + "|" + contextString + "|" + argumentText;
    *status = context == nullptr ? 0 : -1;
    return text.c_str();
}

constexpr const char* PAGE_HEADER =
    "HTTP/1.0 200 OK\r\nServer: Orvex HTTP Server V3.5c\r\nAllow: GET, POST\r\nContent-Type: text/html\r\n"
    "Cache-Control: no-cache\r\nPragma: no-cache\r\nDate: Sun, 06 Nov 1994 08:49:37 GMT\r\n\r\n";

// The engine's output files lie in the working directory.
class OxResourceScript : public testing::Test {
protected:
    OxResourceScript() : m_before(std::filesystem::current_path()) { std::filesystem::current_path(m_work.Path()); }
    ~OxResourceScript() override { std::filesystem::current_path(m_before); }

    static std::unique_ptr<oxRequest> RequestFor(const std::string& text) {
        Connection connection;
        LineLog log;
        auto request = std::make_unique<oxRequest>();
        std::jthread peer([&] { connection.PeerSend(text); });
        EXPECT_TRUE(request->Read(connection.Server(), log) && request->Parse());
        return request;
    }
    static std::unique_ptr<oxRequest> Get(const std::string& url) {
        return RequestFor("GET " + url + " HTTP/1.0\r\n\r\n");
    }
    static std::unique_ptr<oxRequest> Post(const std::string& url, const std::string& body) {
        return RequestFor("POST " + url + " HTTP/1.0\r\nContent-Length: " + std::to_string(body.size()) + "\r\n\r\n" +
                          body);
    }
    static std::string SentBy(oxReply& reply) {
        Connection connection;
        LineLog log;
        ManualClock clock;
        oxTimeStamp stamp(clock);
        reply.SetClock(clock);
        std::string text;
        std::jthread peer([&] { text = connection.PeerReadAll(); });
        reply.Send(connection.Server(), stamp, log);
        connection.Server().Shutdown(SHUT_WR);
        peer.join();
        EXPECT_TRUE(log.Lines().empty());
        return text;
    }
    // What a script of these moves is answered with.
    std::string Play(const std::string& moves, const oxRequest& request) const {
        m_home.Script("page.pl", moves);
        oxResource_Script resource(m_home.Path(), m_home.File("page.pl"), "include", "username=alice&permissions=3",
                                   Echo);
        return SentBy(*resource.GetReply(request));
    }
    std::string Play(const std::string& moves) const { return Play(moves, *Get("/page.pl")); }

    static std::string ScriptError() { return oxReply(Http::INTERNAL_SERVER_ERROR_SCRIPT).ComposeHeader(); }
    bool IsWorkEmpty() const { return std::filesystem::is_empty(m_work.Path()); }

    const EngineHome m_home;
    const Scratch m_work;
    const std::filesystem::path m_before;
};

TEST_F(OxResourceScript, PageOfTheEngineIsTheAnswer) {
    EXPECT_EQ(PAGE_HEADER + std::string("<html>\nhello"), Play("write-output <html>\\nhello\nexitmsg\n"));
    // No output is an empty page, not a missing one.
    EXPECT_EQ(PAGE_HEADER, Play("exitmsg\n"));
    EXPECT_EQ(PAGE_HEADER, Play(""));
    EXPECT_EQ(PAGE_HEADER + std::string("0 24|ctx|username=alice\n"),
              Play("send 24 ctx username=alice\nanswer\nwrite-answer\nexitmsg\n"));
    EXPECT_TRUE(IsWorkEmpty());
}

TEST_F(OxResourceScript, EngineGetsItsEightArguments) {
    m_home.Script("page.pl", "status\n");
    oxResource_Script resource(m_home.Path(), m_home.File("page.pl"), "include", "username=alice&permissions=3", Echo);
    const std::string report = SentBy(*resource.GetReply(*Get("/page.pl?a=b&c")));
    const std::string expected[] = {m_home.Engine(),
                                    "OX_WEBSERVER",
                                    m_home.File("page.pl"),
                                    "NULL",
                                    resource.OutputFile(),
                                    "include",
                                    m_home.Path(),
                                    "5",
                                    "username=alice&permissions=3"};
    for (std::size_t i = 0; i < std::size(expected); ++i)
        EXPECT_EQ(" " + expected[i], LineAfter(report, "argument " + std::to_string(i)));
    EXPECT_EQ("", LineAfter(report, "argument 9"));

    oxResource_Script bare(m_home.Path(), m_home.File("page.pl"), "", "", Echo);
    const std::string other = SentBy(*bare.GetReply(*Get("/page.pl")));
    EXPECT_EQ(" NULL", LineAfter(other, "argument 5"));
    EXPECT_EQ(" 0", LineAfter(other, "argument 7"));
    EXPECT_EQ(" NULL", LineAfter(other, "argument 8"));
}

TEST_F(OxResourceScript, ArgumentTextIsTheInputByteForByte) {
    const std::string moves = "read length\nwrite-body\nexitmsg\n";
    const std::string nul("a\0b", 3);
    EXPECT_EQ(PAGE_HEADER + std::string("x=%20y"), Play(moves, *Get("/page.pl?x=%20y")));
    EXPECT_EQ(PAGE_HEADER + nul, Play(moves, *Post("/page.pl", nul)));
    const std::string large(1000000, 'l');
    EXPECT_TRUE(Play(moves, *Post("/page.pl", large)) == PAGE_HEADER + large);
}

TEST_F(OxResourceScript, EngineThatReadsNothingOfALargeBody) {
    testing::internal::CaptureStderr();
    const std::string page = Play("write-output page\nexit 0\n", *Post("/page.pl", std::string(1000000, 'l')));
    EXPECT_EQ("Unable to transmit query to the scripting engine 32: Broken pipe\n",
              testing::internal::GetCapturedStderr());
    EXPECT_EQ(PAGE_HEADER + std::string("page"), page);
}

TEST_F(OxResourceScript, FailedRunsGetTheScriptErrorPage) {
    for (const char* end : {"exit 3", "kill 9", "kill 15", "exitmsg\nexit 1"}) {
        EXPECT_EQ(ScriptError(), Play(std::string("write-output half a page\n") + end)) << end;
        EXPECT_TRUE(IsWorkEmpty());
    }
    ASSERT_EQ(0, unlink(m_home.Engine().c_str()));
    testing::internal::CaptureStderr();
    EXPECT_EQ(ScriptError(), Play(""));
    EXPECT_EQ("Couldn't launch \"" + m_home.Engine() + "\": No such file or directory (2)\n",
              testing::internal::GetCapturedStderr());
}

// Not only with the resource, which lives until the answer is sent.
TEST_F(OxResourceScript, OutputOfAFailedRunIsClosedAndRemovedBeforeTheAnswer) {
    m_home.Script("page.pl", "write-output half a page\nexit 3\n");
    const auto request = Get("/page.pl");
    const auto before = OpenDescriptors();
    oxResource_Script resource(m_home.Path(), "", "", "", Echo);
    const auto reply = resource.GetReply(*request);
    EXPECT_EQ(&Http::INTERNAL_SERVER_ERROR_SCRIPT, &reply->GetStatus());
    EXPECT_TRUE(resource.OutputFile().starts_with("./.oxscript:"));
    EXPECT_TRUE(IsWorkEmpty());
    EXPECT_EQ(before, OpenDescriptors());
}

TEST_F(OxResourceScript, WhichScriptAndWhichDirectory) {
    m_home.Script("sub/page.pl", "write-output sub\n");
    m_home.Script("page.pl", "write-output home\n");
    std::filesystem::create_symlink(OX_TEST_ENGINE, m_home.File("sub/ox_script.bin"));
    std::filesystem::create_symlink(OX_TEST_ENGINE, m_work.File("ox_script.bin"));
    m_work.Write("bare.pl", "write-output bare\n");
    const std::string bad = oxReply(Http::BAD_REQUEST_400).ComposeHeader();
    const std::string missing = oxReply(Http::NOT_FOUND_404).ComposeHeader();
    const std::string home = m_home.Path();
    const struct {
        std::string directory;
        std::string script;
        std::string url;
        std::string expected;
    } cases[] = {
        {home, "", "/page.pl", PAGE_HEADER + std::string("home")},
        {home, "", "/sub/page.pl", PAGE_HEADER + std::string("sub")},
        {home, home + "/sub/page.pl", "/other.pl", PAGE_HEADER + std::string("sub")},
        {"", home + "/sub/page.pl", "/other.pl", PAGE_HEADER + std::string("sub")},
        {"", "", "/page.pl", bad},
        // It is there, but in no directory that its path tells.
        {"", "bare.pl", "/page.pl", bad},
        {"", "./bare.pl", "/page.pl", PAGE_HEADER + std::string("bare")},
        {home, "", "/absent.pl", missing},
        {home, home + "/absent.pl", "/page.pl", missing},
        {"", "absent.pl", "/page.pl", missing},
    };
    for (const auto& c : cases) {
        oxResource_Script resource(c.directory, c.script, "", "", Echo);
        EXPECT_EQ(c.expected, SentBy(*resource.GetReply(*Get(c.url))))
            << c.directory << " " << c.script << " " << c.url;
    }
}

TEST_F(OxResourceScript, OutputFilesAreNumberedInHexadecimal) {
    m_home.Script("page.pl", "write-output x\n");
    const auto request = Get("/page.pl");
    std::uint32_t last = 0;
    for (int i = 0; i < 17; ++i) {
        oxResource_Script resource(m_home.Path(), "", "", "", Echo);
        EXPECT_EQ("", resource.OutputFile());
        EXPECT_TRUE(last == 0 || resource.PipeID() == last + 1);
        last = resource.PipeID();
        const auto reply = resource.GetReply(*request);
        char expected[32];
        std::snprintf(expected, sizeof expected, "./.oxscript:%x", last);
        EXPECT_EQ(expected, resource.OutputFile());
        EXPECT_TRUE(std::filesystem::exists(resource.OutputFile()));
        EXPECT_EQ(1u, reply->GetContentSize());
    }
    EXPECT_TRUE(IsWorkEmpty());
}

TEST_F(OxResourceScript, OutputFileIsANewOneWithItsMode) {
    m_home.Script("page.pl", "write-output page\nexitmsg\n");
    const std::string victim = m_home.Files().Write("victim", "untouched");
    const mode_t mask = umask(0);
    for (const bool planted : {true, false}) {
        oxResource_Script resource(m_home.Path(), "", "", "", Echo);
        const std::string name = "./.oxscript:" + [&] {
            char hex[16];
            std::snprintf(hex, sizeof hex, "%x", resource.PipeID());
            return std::string(hex);
        }();
        if (planted)
            std::filesystem::create_symlink(victim, name);
        else
            m_work.Write(name.substr(2), "what an earlier server left");
        EXPECT_EQ(PAGE_HEADER + std::string("page"), SentBy(*resource.GetReply(*Get("/page.pl"))));
        struct stat status {};
        EXPECT_EQ(0, lstat(resource.OutputFile().c_str(), &status));
        EXPECT_EQ(static_cast<mode_t>(S_IFREG | 0664), status.st_mode);
    }
    umask(mask);
    EXPECT_EQ("untouched", m_home.Files().Read("victim"));
    EXPECT_TRUE(IsWorkEmpty());
}

TEST_F(OxResourceScript, OutputFileThatCannotBeOpened) {
    m_home.Script("page.pl", "write-output page\n");
    oxResource_Script resource(m_home.Path(), "", "", "", Echo);
    char name[32];
    std::snprintf(name, sizeof name, "./.oxscript:%x", resource.PipeID());
    std::filesystem::create_directories(std::string(name) + "/not/empty");
    EXPECT_EQ(oxReply(Http::INTERNAL_SERVER_ERROR_500).ComposeHeader(), SentBy(*resource.GetReply(*Get("/page.pl"))));
    // The place among the running ones was given back: as many again may fail and run.
    for (unsigned i = 0; i < oxResource_Script::MAX_ENGINES; ++i)
        EXPECT_EQ(PAGE_HEADER + std::string("page"), Play("write-output page\n"));
}

TEST_F(OxResourceScript, PageIsReadFromTheFileThatWasOpened) {
    EXPECT_EQ(PAGE_HEADER, Play("replace-output page\n"));
    EXPECT_TRUE(IsWorkEmpty());
}

TEST_F(OxResourceScript, ContentSizeIsTheFilesSize) {
    m_home.Script("page.pl", "write-output 12345\n");
    oxResource_Script resource(m_home.Path(), "", "", "", Echo);
    EXPECT_EQ(5u, resource.GetReply(*Get("/page.pl"))->GetContentSize());
}

TEST_F(OxResourceScript, TimeLimitEndsTheScript) {
    m_home.Script("page.pl", "write-output half\nforever\n");
    oxResource_Script resource(m_home.Path(), "", "", "", Echo);
    resource.SetTimeLimit(std::chrono::seconds(1));
    EXPECT_EQ(ScriptError(), SentBy(*resource.GetReply(*Get("/page.pl"))));
    EXPECT_FALSE(HasChildren());
}

TEST_F(OxResourceScript, StopEndsTheScript) {
    m_home.Script("page.pl", "touch " + m_home.File("started") + "\nforever\n");
    std::atomic<bool> stop{false};
    std::jthread stopper([&] {
        EXPECT_TRUE(Eventually([&] { return std::filesystem::exists(m_home.File("started")); }));
        stop = true;
    });
    oxResource_Script resource(m_home.Path(), "", "", "", Echo);
    resource.SetStopFlag(stop);
    EXPECT_EQ(ScriptError(), SentBy(*resource.GetReply(*Get("/page.pl"))));
    EXPECT_FALSE(HasChildren());
}

TEST_F(OxResourceScript, SixteenRunAtOnceAndTheNextWaits) {
    constexpr unsigned MAX = oxResource_Script::MAX_ENGINES;
    const auto started = [&] {
        unsigned count = 0;
        for (const auto& entry : std::filesystem::directory_iterator(m_home.Path()))
            count +=
                entry.path().filename().string().starts_with("started") && entry.path().extension() != ".new" ? 1 : 0;
        return count;
    };
    // The fifth argument names the file that lets the script go on.
    m_home.Script("page.pl", "touch " + m_home.Path() + "/started-%8\nwait-file %5\nwrite-output %8\nexitmsg\n");
    const auto request = Get("/page.pl");
    std::vector<std::unique_ptr<oxResource_Script>> resources;
    for (unsigned i = 0; i <= MAX; ++i)
        resources.push_back(std::make_unique<oxResource_Script>(
            m_home.Path(), "", m_home.File("go" + std::to_string(i)), std::to_string(i), Echo));
    std::vector<std::unique_ptr<oxReply>> replies(MAX + 1);
    const auto run = [&](unsigned i) { replies[i] = resources[i]->GetReply(*request); };
    std::vector<std::jthread> threads;
    for (unsigned i = 0; i < MAX; ++i)
        threads.emplace_back(run, i);
    ASSERT_TRUE(Eventually([&] { return started() == MAX; }));

    threads.emplace_back(run, MAX);
    // A request that is stopped while it waits answers soon, without an engine.
    std::atomic<bool> stop{false};
    std::jthread stopper([&] { stop = true; });
    oxResource_Script stopped(m_home.Path(), "", "", "stopped", Echo);
    stopped.SetStopFlag(stop);
    EXPECT_EQ(ScriptError(), SentBy(*stopped.GetReply(*request)));
    EXPECT_EQ("", stopped.OutputFile());
    // Long enough for an engine that is not held up.
    EXPECT_FALSE(Eventually([&] { return started() > MAX; }, std::chrono::milliseconds(700)));

    m_home.Files().Write("go3", "");
    EXPECT_TRUE(Eventually([&] { return started() == MAX + 1; }));
    for (unsigned i = 0; i <= MAX; ++i)
        m_home.Files().Write("go" + std::to_string(i), "");
    threads.clear();
    for (unsigned i = 0; i <= MAX; ++i)
        EXPECT_EQ(PAGE_HEADER + std::to_string(i), SentBy(*replies[i]));
    resources.clear();
    EXPECT_TRUE(IsWorkEmpty());
}

TEST_F(OxResourceScript, ManyRequestsLeaveNothingBehind) {
    const auto request = Post("/page.pl", "body");
    Play("", *request);
    const auto before = OpenDescriptors();
    for (int i = 0; i < 20; ++i) {
        Play("read length\nwrite-body\nexitmsg\n", *request);
        Play("kill 9\n", *request);
        Play("read length\nsend 60 1 -\nexpect 0 TOKEN RETREIVED SUCCESSFULLY\nexit 1\n", *request);
    }
    {
        // A reply that is never sent gives its file back too.
        m_home.Script("page.pl", "write-output page\n");
        oxResource_Script resource(m_home.Path(), "", "", "", Echo);
        resource.GetReply(*request);
    }
    EXPECT_FALSE(HasChildren());
    EXPECT_EQ(before, OpenDescriptors());
    EXPECT_TRUE(IsWorkEmpty());
}

}  // namespace
