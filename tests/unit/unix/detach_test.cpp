#include "unix/detach.h"

#include <grp.h>
#include <gtest/gtest.h>

#include "unix/testtools.h"

namespace {
using Lines = std::vector<std::string>;

bool IsNull(int descriptor) {
    struct stat mine;
    struct stat null;
    return fstat(descriptor, &mine) == 0 && stat("/dev/null", &null) == 0 && mine.st_rdev == null.st_rdev &&
           S_ISCHR(mine.st_mode);
}

std::string Ids(const char* kind, unsigned real, unsigned effective) {
    return std::string("7|") + kind + "id=" + std::to_string(real) + " e" + kind + "id=" + std::to_string(effective);
}

// Detaches as it is and says nothing; whether all three ids are this user's then.
bool IsWhollyAfterDetaching(uid_t user) {
    LinesAudit audit;
    oxDetachOptions options;
    options.changeDirectory = false;
    DetachProcess(options, ".", oxStartupConfig(), audit);
    uid_t real;
    uid_t effective;
    uid_t saved;
    getresuid(&real, &effective, &saved);
    return real == user && effective == user && saved == user && audit.lines.empty();
}
}  // namespace

// In a child: puts one open file on the three standard descriptors; its own, above them.
int ZeroOnStandardStreams() {
    const int zero = open("/dev/zero", O_RDWR);
    for (int i = 0; i < 3; ++i)
        dup2(zero, i);
    return zero;
}

TEST(FillStandardDescriptors, OpensOnlyWhatIsClosed) {
    EXPECT_EQ(RunInChild([] {
                  const int marker = open("/dev/zero", O_RDONLY);
                  dup2(marker, 1);
                  close(marker);
                  close(0);
                  close(2);
                  FillStandardDescriptors();
                  if (!IsNull(0) || IsNull(1) || !IsNull(2))
                      return 1;
                  const int next = open("/dev/null", O_RDONLY);
                  close(next);
                  FillStandardDescriptors();
                  const int again = open("/dev/null", O_RDONLY);
                  return next > 2 && again == next ? 0 : 2;
              }),
              0);
}

TEST(DropInheritedDescriptors, ClosesAllAboveStandardError) {
    EXPECT_EQ(RunInChild([] {
                  const int zero = ZeroOnStandardStreams();
                  const int far = fcntl(zero, F_DUPFD, 500);
                  const int own = fcntl(zero, F_DUPFD_CLOEXEC, 600);
                  if (zero < 3 || far < 500 || own < 600)
                      return 1;
                  DropInheritedDescriptors(true);
                  for (const int gone : {zero, far, own})
                      if (fcntl(gone, F_GETFD) != -1 || errno != EBADF)
                          return 2;
                  for (int i = 0; i < 3; ++i)
                      if (fcntl(i, F_GETFD) != 0)
                          return 3;
                  return 0;
              }),
              0);
}

TEST(DropInheritedDescriptors, OrOnlyKeepsThemFromStartedPrograms) {
    EXPECT_EQ(RunInChild([] {
                  const int zero = ZeroOnStandardStreams();
                  const int far = fcntl(zero, F_DUPFD, 500);
                  if (zero < 3 || far < 500 || fcntl(zero, F_GETFD) != 0 || fcntl(far, F_GETFD) != 0)
                      return 1;
                  DropInheritedDescriptors(false);
                  if (fcntl(zero, F_GETFD) != FD_CLOEXEC || fcntl(far, F_GETFD) != FD_CLOEXEC)
                      return 2;
                  for (int i = 0; i < 3; ++i)
                      if (fcntl(i, F_GETFD) != 0)
                          return 3;
                  return 0;
              }),
              0);
}

TEST(SilenceStandardStreams, PointsInputAndOutputAtNothing) {
    EXPECT_EQ(RunInChild([] {
                  const int zero = ZeroOnStandardStreams();
                  close(zero);
                  SilenceStandardStreams();
                  return IsNull(0) && IsNull(1) && !IsNull(2) && open("/dev/null", O_RDONLY) == zero ? 0 : 1;
              }),
              0);
}

TEST(DetachProcess, SettlesMaskSessionAndDirectory) {
    const ScratchDirectory scratch;
    std::filesystem::create_directory("there");
    oxStartupConfig config;
    config.uid = static_cast<int>(geteuid());
    config.gid = static_cast<int>(getegid());
    EXPECT_EQ(RunInChild([&] {
                  LinesAudit audit;
                  umask(077);
                  DetachProcess({}, scratch.File("there"), config, audit);
                  if (umask(0) != 0)
                      return 1;
                  if (getsid(0) != getpid())
                      return 2;
                  if (std::filesystem::current_path().filename() != "there")
                      return 3;
                  if (audit.lines.empty() || audit.lines[0] != "3|Changing dir to " + scratch.File("there") + ";")
                      return 4;
                  return 0;
              }),
              0);
}

TEST(DetachProcess, WithoutASessionAndADirectoryOfItsOwn) {
    const ScratchDirectory scratch;
    oxStartupConfig config;
    config.uid = static_cast<int>(geteuid());
    config.gid = static_cast<int>(getegid());
    EXPECT_EQ(RunInChild([&] {
                  LinesAudit audit;
                  const pid_t session = getsid(0);
                  oxDetachOptions options;
                  options.newSession = false;
                  DetachProcess(options, scratch.File("none"), config, audit);
                  const Lines wanted{"3|Changing dir to " + scratch.File("none") + ";",
                                     "3|WARNING: Unable to chdir to " + scratch.File("none") + "."};
                  return getsid(0) == session && audit.lines.size() >= 2 &&
                                 Lines(audit.lines.begin(), audit.lines.begin() + 2) == wanted
                             ? 0
                             : 1;
              }),
              0);
}

TEST(DetachProcess, ASecondSessionOfOneProcessIsAWarning) {
    const ScratchDirectory scratch;
    oxStartupConfig config;
    config.uid = static_cast<int>(geteuid());
    config.gid = static_cast<int>(getegid());
    EXPECT_EQ(RunInChild([&] {
                  LinesAudit audit;
                  setsid();
                  DetachProcess({}, ".", config, audit);
                  return audit.lines.at(0) == "WARNING: setsid() failed: Operation not permitted (1)" ? 0 : 1;
              }),
              0);
}

TEST(DetachProcess, AnOrdinaryUserStaysWhoHeIs) {
    const ScratchDirectory scratch;
    EXPECT_EQ(RunInChild([&] {
                  const uid_t user = getuid() == 0 ? 1234 : getuid();
                  if (getuid() == 0 && setresuid(user, user, user) != 0)
                      return 1;
                  return IsWhollyAfterDetaching(user) ? 0 : 2;
              }),
              0);
}

TEST(DetachProcess, ASetUidPrivilegeIsDropped) {
    if (getuid() != 0)
        GTEST_SKIP() << "needs root";
    EXPECT_EQ(RunInChild([] {
                  constexpr uid_t USER = 1234;
                  if (setresuid(USER, 0, 0) != 0)
                      return 1;
                  return IsWhollyAfterDetaching(USER) ? 0 : 2;
              }),
              0);
}

TEST(DetachProcess, RootTakesTheConfiguredIds) {
    if (getuid() != 0)
        GTEST_SKIP() << "needs root";
    const struct {
        int uid;
        unsigned effective;
        Lines warnings;
    } rows[] = {{77, 77, {}},
                {0, 0, {}},
                {65535, 65535, {"1|Warning: running as uid 65535 is a security risk."}},
                {-1, 0, {"1|Warning: running as uid -1 is a security risk."}}};
    for (const auto& row : rows) {
        SCOPED_TRACE(row.uid);
        EXPECT_EQ(RunInChild([&] {
                      // As the command leaves it: another effective user already.
                      if (seteuid(1) != 0)
                          return 1;
                      oxStartupConfig config;
                      config.gid = 88;
                      config.uid = row.uid;
                      LinesAudit audit;
                      oxDetachOptions options;
                      options.changeDirectory = false;
                      DetachProcess(options, ".", config, audit);
                      Lines wanted{Ids("g", 88, 88)};
                      if (row.uid == -1)
                          wanted.push_back("7|seteuid: Invalid argument");
                      wanted.push_back(Ids("u", 0, row.effective));
                      wanted.insert(wanted.end(), row.warnings.begin(), row.warnings.end());
                      if (audit.lines != wanted) {
                          for (const auto& line : audit.lines)
                              std::fprintf(stderr, "%s\n", line.c_str());
                          return 2;
                      }
                      gid_t groups[64];
                      return getgroups(64, groups) == 1 && groups[0] == 88 && geteuid() == row.effective ? 0 : 3;
                  }),
                  0);
    }
}
