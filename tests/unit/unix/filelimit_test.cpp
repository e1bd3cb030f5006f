#include "unix/filelimit.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <string>
#include <vector>

#include "proc.h"
#include "unix/testtools.h"

namespace {
constexpr uid_t ROOT = 0;
constexpr uid_t USER = 1000;
constexpr int MOST = 2147483647;
constexpr rlim_t UNLIMITED = RLIM_INFINITY;

class FakeLimit : public oxLimitCalls {
public:
    int Get(rlimit& limit) override {
        limit = now;
        return 0;
    }
    int Set(const rlimit& limit) override {
        ++sets;
        if (setError != 0) {
            errno = setError;
            return -1;
        }
        now = limit;
        return 0;
    }
    uid_t EffectiveUser() override { return user; }
    void KeepForChildren(const rlimit& limit) override { kept.push_back(limit); }

    rlimit now{};
    std::vector<rlimit> kept;
    uid_t user = USER;
    int setError = 0;
    int sets = 0;
};

struct Row {
    int wanted;
    uid_t user;
    rlim_t soft;
    rlim_t hard;
    int setError;
    rlim_t newSoft;
    rlim_t newHard;
    int sets;
    std::vector<std::string> lines;
};
}  // namespace

TEST(RaiseFileLimit, FollowsTheWantedNumber) {
    const Row rows[] = {
        {-1, USER, 1024, 4096, 0, 4096, 4096, 1, {"5|RLIMIT_NOFILE set to 4096."}},
        {-1, USER, 4096, 4096, 0, 4096, 4096, 0, {}},
        {2000, USER, 1024, 4096, 0, 2000, 2000, 1, {"5|RLIMIT_NOFILE set to 2000."}},
        {512, USER, 1024, 4096, 0, 1024, 4096, 0, {}},
        {1024, USER, 1024, 4096, 0, 1024, 4096, 0, {}},
        {0, USER, 1024, 4096, 0, 1024, 4096, 0, {}},
        {-7, USER, 1024, 4096, 0, 1024, 4096, 0, {}},
        {5000,
         USER,
         1024,
         4096,
         0,
         4096,
         4096,
         1,
         {"Warning: Non-root users cannot set RLIMIT_NOFILE to greater than 4096 handles. (handles=5000)",
          "5|RLIMIT_NOFILE set to 4096."}},
        {5000,
         USER,
         4096,
         4096,
         0,
         4096,
         4096,
         0,
         {"Warning: Non-root users cannot set RLIMIT_NOFILE to greater than 4096 handles. (handles=5000)"}},
        {5000, ROOT, 1024, 4096, 0, 5000, 5000, 1, {"5|RLIMIT_NOFILE set to 5000."}},
        {5000, ROOT, 1024, 4096, EPERM, 1024, 4096, 1, {"5|setrlimit: Operation not permitted"}},
        {-1, USER, 1024, UNLIMITED, 0, MOST, MOST, 1, {"5|RLIMIT_NOFILE set to unlimited."}},
        {MOST, ROOT, 1024, 4096, 0, MOST, MOST, 1, {"5|RLIMIT_NOFILE set to unlimited."}},
        {-1, USER, UNLIMITED, UNLIMITED, 0, UNLIMITED, UNLIMITED, 0, {}},
    };
    for (const auto& row : rows) {
        SCOPED_TRACE(std::to_string(row.wanted) + " of " + std::to_string(row.hard));
        FakeLimit fake;
        fake.now = {row.soft, row.hard};
        fake.user = row.user;
        fake.setError = row.setError;
        LinesAudit audit;
        RaiseFileLimit(row.wanted, audit, fake);
        EXPECT_EQ(fake.now.rlim_cur, row.newSoft);
        EXPECT_EQ(fake.now.rlim_max, row.newHard);
        EXPECT_EQ(fake.sets, row.sets);
        ASSERT_EQ(fake.kept.size(), 1U);
        EXPECT_EQ(fake.kept[0].rlim_cur, row.soft) << "as it was found";
        EXPECT_EQ(fake.kept[0].rlim_max, row.hard);
        EXPECT_EQ(audit.lines, row.lines);
    }
}

TEST(RaiseFileLimit, RaisesTheRealLimit) {
    EXPECT_EQ(RunInChild([] {
                  rlimit limit{};
                  getrlimit(RLIMIT_NOFILE, &limit);
                  limit.rlim_cur = 40;
                  setrlimit(RLIMIT_NOFILE, &limit);
                  LinesAudit audit;
                  RaiseFileLimit(50, audit);
                  getrlimit(RLIMIT_NOFILE, &limit);
                  return limit.rlim_cur == 50 && limit.rlim_max == 50 ? 0 : 1;
              }),
              0);
}

TEST(RaiseFileLimit, ALimitThatCannotBeReadIsToldAndNotKept) {
    class Unreadable : public FakeLimit {
        int Get(rlimit&) override {
            errno = EPERM;
            return -1;
        }
    } fake;
    LinesAudit audit;
    RaiseFileLimit(2000, audit, fake);
    EXPECT_EQ(audit.lines, std::vector<std::string>{"5|getrlimit: Operation not permitted"});
    EXPECT_TRUE(fake.kept.empty());
    EXPECT_EQ(fake.sets, 0);
}

TEST(RaiseFileLimit, ChildrenGetTheLimitThatWasFound) {
    EXPECT_EQ(RunInChild([] {
                  rlimit limit{};
                  getrlimit(RLIMIT_NOFILE, &limit);
                  limit.rlim_cur = 40;
                  setrlimit(RLIMIT_NOFILE, &limit);
                  LinesAudit audit;
                  RaiseFileLimit(-1, audit);
                  getrlimit(RLIMIT_NOFILE, &limit);
                  if (limit.rlim_cur <= 40)
                      return 1;
                  oxProc proc;
                  proc.Spawn("/bin/sh", "-c test\t$(ulimit\t-n)\t=\t40");
                  return proc.Wait(oxProc::NO_LIMIT) == 0 ? 0 : 2;
              }),
              0);
}
