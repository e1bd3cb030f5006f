// Runs checks of accounts, step by step as its arguments say, and prints what came of each. The tests start it where
// the machine's accounts are their own.
//
//   unix|shadow|pam USER PASSWORD     "authenticated error message"
//   again METHOD USER PASSWORD        checks of one object with given and stored texts, a line each
//   base USER PASSWORD                "1" or "0"
//   library PATH SONAME               what PAM is loaded from
//   rename FROM TO
//   groups ID                         the one supplementary group
//   lower                             effective user 1 for the process, the real one stays
//   drop                              user 1 for good
//   threads N                         idle threads, until the end
//   ids                               the effective users and groups that threads have, a line each
//   two RELEASE                       two PAM checks, the second while the first waits for the file RELEASE
//   parallel DIRECTORY                many checks at once while files are made
#include <dirent.h>
#include <grp.h>
#include <sys/prctl.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <atomic>
#include <cstdio>
#include <cstdlib>
#include <deque>
#include <filesystem>
#include <fstream>
#include <functional>
#include <latch>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "testing/waiting.h"
#include "users/authpam.h"
#include "users/authshadow.h"
#include "users/authunix.h"
#include "users/osuserbase.h"

namespace {

constexpr uid_t ORDINARY_USER = 1;

void Print(const std::string& line) {
    std::printf("%s\n", line.c_str());
    std::fflush(stdout);
}

struct ChosenPam : oxAuthPAM {
    // The texts live as long as the process.
    static void Choose(const std::string& path, const std::string& soname) {
        static std::deque<std::string> texts;
        m_pszLibrary = texts.emplace_back(path).c_str();
        m_pszLibrarySoname = texts.emplace_back(soname).c_str();
    }
};

std::unique_ptr<oxAuthenticate> Make(const std::string& method, const char* user, const char* password) {
    if (method == "unix")
        return std::make_unique<oxAuthUnix>(user, password);
    if (method == "shadow")
        return std::make_unique<oxAuthShadow>(user, password);
    return std::make_unique<oxAuthPAM>(user, password);
}

std::string Outcome(const oxAuthenticate& check) {
    return std::to_string(check.IsAuthenticated()) + " " + std::to_string(check.Error()) + " " + check.Message();
}

void Again(const std::string& method, const std::string& user, const std::string& password) {
    const auto check = Make(method, nullptr, nullptr);
    Print("empty " + Outcome(*check));
    const auto ask = [&](const char* what, const char* name, const char* secret) {
        const bool result = check->Authenticate(name, secret);
        Print(what + (" " + Outcome(*check)) + (result == check->IsAuthenticated() ? "" : " but it said otherwise"));
    };
    ask("given", user.c_str(), password.c_str());
    ask("stored", nullptr, nullptr);
    ask("stored name", nullptr, "wrong");
    ask("stored wrong", nullptr, nullptr);
    ask("stored name again", nullptr, password.c_str());
    ask("other name", "nobody-of-that-name", nullptr);
}

std::set<std::string> IdsOfThreads() {
    std::set<std::string> ids;
    for (const auto& task : std::filesystem::directory_iterator("/proc/self/task")) {
        std::ifstream status(task.path() / "status");
        std::string found;
        for (std::string line; std::getline(status, line);) {
            unsigned real = 0;
            unsigned effective = 0;
            if (std::sscanf(line.c_str(), "Uid: %u %u", &real, &effective) == 2)
                found += "euid=" + std::to_string(effective);
            if (line.starts_with("Groups:"))
                found += " groups=" + line.substr(sizeof "Groups:");
        }
        while (found.ends_with(' '))
            found.pop_back();
        ids.insert(found);
    }
    return ids;
}

void PrintIds() {
    for (const std::string& ids : IdsOfThreads())
        Print(ids);
}

bool Sleeps(long thread) {
    std::ifstream stat("/proc/self/task/" + std::to_string(thread) + "/stat");
    std::string text;
    std::getline(stat, text);
    const auto name = text.rfind(')');
    return name != std::string::npos && text.substr(name, 3) == ") S";
}

void Two(const std::string& release) {
    std::string first;
    std::string second;
    std::thread one([&] { first = Outcome(oxAuthPAM("first", "secret1")); });
    bool waited = Eventually([&] { return access((release + ".begun").c_str(), F_OK) == 0; });
    std::atomic<long> id{0};
    std::thread two([&] {
        id = syscall(SYS_gettid);
        second = Outcome(oxAuthPAM("second", "secret2"));
    });
    waited = Eventually([&] { return id != 0 && Sleeps(id); }) && waited;
    std::ofstream(release) << "";
    one.join();
    two.join();
    Print(first);
    Print(second);
    Print(waited ? "waited" : "did not wait");
}

// Accounts "yescrypt" and "sha512" in the shadow file, "open512" in the passwd file, each with its name as the
// password.
void Parallel(const std::string& directory) {
    struct Case {
        const char* method;
        const char* user;
    };
    static constexpr Case CASES[] = {
        {"shadow", "yescrypt"}, {"shadow", "sha512"}, {"unix", "open512"}, {"pam", "sha512"}};
    constexpr int CHECKERS = 8;
    constexpr int ROUNDS = 40;
    const uid_t user = geteuid();
    std::atomic<int> wrong{0};
    std::atomic<int> foreign{0};
    std::atomic<int> files{0};
    std::latch checked(CHECKERS);
    std::latch seen(1);
    std::atomic<bool> stop{false};
    std::thread writer([&] {
        do {
            const std::string path = directory + "/" + std::to_string(files++);
            std::ofstream(path) << "x";
            struct stat status;
            if (stat(path.c_str(), &status) != 0 || status.st_uid != user)
                ++foreign;
            unlink(path.c_str());
        } while (!stop);
        seen.wait();
    });
    std::vector<std::thread> checkers;
    for (int i = 0; i < CHECKERS; ++i) {
        checkers.emplace_back([&, i] {
            for (int round = 0; round < ROUNDS; ++round) {
                const Case& one = CASES[static_cast<std::size_t>(i + round / 2) % std::size(CASES)];
                const bool right = (i + round) % 2 == 0;
                const auto check = Make(one.method, one.user, right ? one.user : "wrong");
                if (check->IsAuthenticated() != right || geteuid() != user)
                    ++wrong;
            }
            checked.count_down();
            seen.wait();
        });
    }
    checked.wait();
    stop = true;
    PrintIds();
    seen.count_down();
    for (std::thread& checker : checkers)
        checker.join();
    writer.join();
    Print("wrong=" + std::to_string(wrong) + " foreign=" + std::to_string(foreign) +
          (files > 1 ? " files" : " no files"));
}

[[noreturn]] void Refuse(const std::string& why) {
    std::fprintf(stderr, "accountcheck: %s\n", why.c_str());
    std::_Exit(2);
}

void MustWork(bool worked, const char* what) {
    if (!worked)
        Refuse(what);
}

}  // namespace

int main(int count, char** arguments) {
    std::deque<std::string> left(arguments + 1, arguments + count);
    const auto next = [&] {
        if (left.empty())
            Refuse("an argument is missing");
        std::string argument = left.front();
        left.pop_front();
        return argument;
    };
    OSUserBase base;
    std::latch end(1);
    std::vector<std::thread> idle;
    const auto check = [&](const char* method) {
        return [&, method] {
            const std::string user = next();
            const std::string password = next();
            Print(Outcome(*Make(method, user.c_str(), password.c_str())));
        };
    };
    const std::map<std::string, std::function<void()>> steps = {
        {"unix", check("unix")},
        {"shadow", check("shadow")},
        {"pam", check("pam")},
        {"again",
         [&] {
             const std::string method = next();
             const std::string user = next();
             Again(method, user, next());
         }},
        {"base",
         [&] {
             const std::string user = next();
             Print(base.Authenticate(user, next(), nullptr) ? "1" : "0");
         }},
        {"library",
         [&] {
             const std::string path = next();
             ChosenPam::Choose(path, next());
         }},
        {"rename",
         [&] {
             const std::string from = next();
             std::filesystem::rename(from, next());
         }},
        {"groups",
         [&] {
             const gid_t group = static_cast<gid_t>(std::stoul(next()));
             MustWork(setgroups(1, &group) == 0, "setgroups");
         }},
        {"lower", [&] { MustWork(seteuid(ORDINARY_USER) == 0, "seteuid"); }},
        {"drop", [&] { MustWork(setresuid(ORDINARY_USER, ORDINARY_USER, ORDINARY_USER) == 0, "setresuid"); }},
        {"threads",
         [&] {
             for (int number = std::stoi(next()); number > 0; --number)
                 idle.emplace_back([&] { end.wait(); });
         }},
        {"ids", PrintIds},
        {"two", [&] { Two(next()); }},
        {"parallel", [&] { Parallel(next()); }},
    };
    while (!left.empty()) {
        const std::string step = next();
        const auto found = steps.find(step);
        if (found == steps.end())
            Refuse("no such step: " + step);
        found->second();
    }
    end.count_down();
    for (std::thread& thread : idle)
        thread.join();
    // For the leak check at exit, which attaches to this process.
    MustWork(seteuid(getuid()) == 0 && prctl(PR_SET_DUMPABLE, 1) == 0, "the end");
    return 0;
}
