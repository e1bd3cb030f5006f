#include "unix/programpath.h"

#include <gtest/gtest.h>

#include "unix/testtools.h"

TEST(ProgramPath, DirectoryIsMadeAbsoluteAndFilesLieBeside) {
    const ScratchDirectory scratch;
    const std::string here = std::filesystem::current_path();
    const struct {
        const char* called;
        std::string directory;
        std::string pidFile;
    } rows[] = {
        {"ox_remote", here, here + "/ox_remote.pid"},
        {"./ox_remote", here, here + "/ox_remote.pid"},
        {"bin/ox_remote", here + "/bin", here + "/bin/ox_remote.pid"},
        {"./bin/ox_remote", here + "/bin", here + "/bin/ox_remote.pid"},
        {"../d/x", here + "/../d", here + "/../d/x.pid"},
        {"/opt/v1.2/ox_remote", "/opt/v1.2", "/opt/v1.2/ox_remote.pid"},
        {"/opt/srv.bin", "/opt", "/opt/srv.pid"},
        {"/srv", "/", "/srv.pid"},
        {"", here, here + "/.pid"},
        {nullptr, here, here + "/.pid"},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(row.called != nullptr ? row.called : "(null)");
        const oxFilename program = ProgramPath(row.called);
        EXPECT_EQ(program.Directory(), row.directory);
        EXPECT_EQ(BesideProgram(program, "pid"), row.pidFile);
    }
}

TEST(ProgramPath, BackslashAndBlanksInTheWorkingDirectoryAreKept) {
    const ScratchDirectory scratch;
    for (const char* name : {"a\\b", " two  blanks ", "\\ \\", "dir.with\\dot . s"}) {
        SCOPED_TRACE(name);
        const std::string here = scratch.File(name);
        ASSERT_TRUE(std::filesystem::create_directory(here));
        std::filesystem::current_path(here);
        for (const char* called : {"ox_remote", "./ox_remote"}) {
            const oxFilename program = ProgramPath(called);
            EXPECT_EQ(program.Directory(), here) << called;
            EXPECT_EQ(BesideProgram(program, "pid"), here + "/ox_remote.pid") << called;
        }
        EXPECT_EQ(ProgramPath("bin/ox_remote").Directory(), here + "/bin");
    }
}
