#include "unix/pidfile.h"

#include <gtest/gtest.h>
#include <signal.h>

#include <cerrno>
#include <limits>

#include "unix/testtools.h"

namespace {
using Lines = std::vector<std::string>;
constexpr const char* TITLE = "Some Title";

class OxPidFile : public testing::Test {
protected:
    ScratchDirectory scratch;
    std::string path = scratch.File("x.pid");
    LinesAudit audit;
    oxPidFile pidFile{path, audit};
};
}  // namespace

TEST_F(OxPidFile, ReadsTheNumber) {
    const struct {
        const char* text;
        pid_t pid;
    } rows[] = {{"123\n", 123},
                {"123", 123},
                {" 7 8", 7},
                {"12x", 12},
                {"", 0},
                {"abc\n", 0},
                {"-1\n", -1},
                {"-9999999999", -2147483647 - 1},
                {"99999999999", 2147483647},
                {"9999999999999999999999", 2147483647},
                // Only the first 19 bytes count.
                {"00000000000000000012345", 1},
                {"99\n4567\n", 99}};
    for (const auto& row : rows) {
        WriteText(path, row.text);
        const auto pid = pidFile.Read();
        ASSERT_TRUE(pid) << row.text;
        EXPECT_EQ(*pid, row.pid) << row.text;
    }
    EXPECT_TRUE(audit.lines.empty());
}

TEST_F(OxPidFile, AMissingFileIsUnreadableWithoutALine) {
    EXPECT_FALSE(pidFile.Read());
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(pidFile.Signal(0));
    EXPECT_EQ(errno, ENOENT);
    EXPECT_FALSE(pidFile.NamesRunningProcess());
    EXPECT_TRUE(audit.lines.empty());
}

TEST_F(OxPidFile, DescriptorZeroCountsAsUnreadableWithALine) {
    WriteText(path, "1\n");
    const int saved = dup(0);
    close(0);
    const bool read = pidFile.Read().has_value();
    const int error = errno;
    const bool left = fcntl(0, F_GETFD) >= 0;
    if (saved >= 0) {
        dup2(saved, 0);
        close(saved);
    }
    EXPECT_FALSE(read);
    EXPECT_EQ(error, EBADF);
    EXPECT_FALSE(left);
    EXPECT_EQ(audit.lines, Lines{"Error: can't open " + path + ": Bad file descriptor"});
}

TEST_F(OxPidFile, GroupsAnswerSignalZeroAndGetNoOther) {
    constexpr pid_t NO_GROUP = std::numeric_limits<pid_t>::min() + 1;
    EXPECT_TRUE(oxPidFile::SignalProcess(0, 0));
    EXPECT_TRUE(oxPidFile::SignalProcess(-getpgrp(), 0));
    EXPECT_FALSE(oxPidFile::SignalProcess(NO_GROUP, 0));
    EXPECT_EQ(errno, ESRCH);
    for (const pid_t pid : {0, -1, -5}) {
        errno = 0;
        EXPECT_FALSE(oxPidFile::SignalProcess(pid, SIGTERM));
        EXPECT_EQ(errno, ESRCH);
        EXPECT_FALSE(oxPidFile::SignalProcess(pid, 31));
    }
    WriteText(path, "abc\n");
    EXPECT_TRUE(pidFile.NamesRunningProcess());
    EXPECT_TRUE(pidFile.Signal(0));
    EXPECT_FALSE(pidFile.Signal(SIGTERM));
    EXPECT_EQ(errno, ESRCH);
}

TEST_F(OxPidFile, TellsWhetherTheProcessRuns) {
    WriteText(path, std::to_string(getpid()));
    EXPECT_TRUE(pidFile.NamesRunningProcess());
    const pid_t child = StartChild([] { return 0; });
    WriteText(path, std::to_string(child));
    siginfo_t info;
    ASSERT_EQ(waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT), 0);
    EXPECT_TRUE(pidFile.Signal(0));
    EXPECT_FALSE(pidFile.NamesRunningProcess()) << "a zombie is no server";
    Reap(child);
    EXPECT_FALSE(pidFile.Signal(0));
    EXPECT_EQ(errno, ESRCH);
    EXPECT_FALSE(pidFile.NamesRunningProcess());
}

TEST_F(OxPidFile, IsWrittenWithItsModeAndRemoved) {
    const mode_t mask = umask(0);
    EXPECT_TRUE(pidFile.Write(TITLE, 4711));
    umask(mask);
    EXPECT_EQ(ReadText(path), "4711\n");
    struct stat status;
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    EXPECT_EQ(status.st_mode & 07777, 0664U);
    pidFile.Remove();
    EXPECT_FALSE(std::filesystem::exists(path));
    EXPECT_TRUE(audit.lines.empty());
}

TEST_F(OxPidFile, IsNotTruncated) {
    WriteText(path, "1234567\n");
    EXPECT_TRUE(pidFile.Write(TITLE, 99));
    EXPECT_EQ(ReadText(path), "99\n4567\n");
}

TEST_F(OxPidFile, TheLockNamesItsHolderAndKeepsOthersOut) {
    ASSERT_TRUE(pidFile.Write(TITLE, getpid()));
    EXPECT_EQ(RunInChild([this] {
                  struct flock lock {};
                  lock.l_type = F_WRLCK;
                  const int file = open(path.c_str(), O_RDWR);
                  fcntl(file, F_GETLK, &lock);
                  return lock.l_type == F_WRLCK && lock.l_pid == getppid() && lock.l_start == 0 && lock.l_len == 0 ? 0
                                                                                                                   : 1;
              }),
              0);
    EXPECT_EQ(RunInChild([this] {
                  LinesAudit lines;
                  oxPidFile other(path, lines);
                  if (other.Write(TITLE, getpid()))
                      return 1;
                  other.Remove();
                  const Lines wanted{"Error: Some Title is already running: Resource temporarily unavailable",
                                     "1|Error: Unable to create lock file, " + path + "."};
                  return lines.lines == wanted ? 0 : 2;
              }),
              0);
    EXPECT_EQ(ReadText(path), std::to_string(getpid()) + "\n");
}

TEST_F(OxPidFile, AnUnlockedFileOfADeadServerIsTaken) {
    EXPECT_EQ(RunInChild([this] { return oxPidFile(path, audit).Write(TITLE, 1) ? 0 : 1; }), 0);
    EXPECT_TRUE(pidFile.Write(TITLE, 2));
    EXPECT_EQ(ReadText(path), "2\n");
}

TEST_F(OxPidFile, CannotBeOpened) {
    oxPidFile nowhere(scratch.File("none/x.pid"), audit);
    EXPECT_FALSE(nowhere.Write(TITLE, 1));
    EXPECT_EQ(audit.lines, (Lines{"Error: can't open pidfile " + nowhere.Path() + ": No such file or directory",
                                  "1|Error: Unable to create lock file, " + nowhere.Path() + "."}));
}

TEST_F(OxPidFile, APipeHoldsNobodyUp) {
    ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
    EXPECT_EQ(RunInChild([this] {
                  alarm(60);
                  if (pidFile.Write(TITLE, 1))
                      return 1;
                  const Lines wanted{"Error: can't open pidfile " + path + ": No such device or address",
                                     "1|Error: Unable to create lock file, " + path + "."};
                  return audit.lines == wanted ? 0 : 2;
              }),
              0);
    EXPECT_TRUE(std::filesystem::is_fifo(path));
}

TEST_F(OxPidFile, CannotBeWritten) {
    std::filesystem::create_symlink("/dev/full", path);
    EXPECT_FALSE(pidFile.Write(TITLE, 1));
    EXPECT_EQ(audit.lines, (Lines{"Error: can't write to " + path + ": No space left on device",
                                  "1|Error: Unable to create lock file, " + path + "."}));
    EXPECT_FALSE(std::filesystem::is_symlink(std::filesystem::symlink_status(path)))
        << "an empty file would pass for a running server";
}

TEST_F(OxPidFile, TheFileOfAnotherServerIsNotRemoved) {
    ASSERT_TRUE(pidFile.Write(TITLE, 1));
    std::filesystem::remove(path);
    WriteText(path, "2\n");
    pidFile.Remove();
    EXPECT_EQ(ReadText(path), "2\n");
    pidFile.Remove();
    EXPECT_EQ(ReadText(path), "2\n");
}

TEST_F(OxPidFile, CannotBeDeleted) {
    EXPECT_EQ(RunInChild([this] {
                  if (!pidFile.Write(TITLE, 1))
                      return 1;
                  if (chmod(scratch.Path().c_str(), 0555) != 0)
                      return 2;
                  // Root may delete everywhere, so an ordinary user plays its part.
                  constexpr uid_t ORDINARY_USER = 65534;
                  if (geteuid() == 0 && setresuid(ORDINARY_USER, ORDINARY_USER, ORDINARY_USER) != 0)
                      return 3;
                  pidFile.Remove();
                  const Lines wanted{"Error: can't delete " + path + ": Permission denied"};
                  return audit.lines == wanted ? 0 : 4;
              }),
              0);
    EXPECT_EQ(chmod(scratch.Path().c_str(), 0700), 0);
    EXPECT_EQ(ReadText(path), "1\n");
    EXPECT_EQ(RunInChild([this] { return oxPidFile(path, audit).Write(TITLE, 2) ? 0 : 1; }), 0)
        << "the lock was given up";
}
