#include "users/support_accounts.h"

#include <crypt.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <memory>

#include "platform/file.h"

namespace {

constexpr const char* PASSWD_START = "root:*:0:0:root:/root:/bin/sh\ndaemon:*:1:1:daemon:/:/bin/sh\n";
constexpr const char* SHADOW_START = "root:*:19000:0:99999:7:::\ndaemon:*:19000:0:99999:7:::\n";
constexpr const char* GROUP = "root:x:0:\ndaemon:x:1:\nreports:x:5555:\n";
constexpr const char* NAME_SERVICES = "passwd: files\nshadow: files\ngroup: files\n";
constexpr const char* PAM_SERVICE =
    "auth required pam_unix.so nodelay\n"
    "auth optional pam_group.so\n"
    "account required pam_unix.so\n";
constexpr const char* PAM_GROUPS = "login;*;*;Al0000-2400;reports\n";

// Arguments: the directory of the files, the planted library's directory, the replacement, then the command.
constexpr const char* SCRIPT = R"sh(set -e
files=$1; planted=$2; replacement=$3; shift 3
for name in passwd shadow group nsswitch.conf pam.d/login security/group.conf; do
    mount --bind "$files/$name" "/etc/$name"
done
if [ -n "$planted" ]; then
    lib=$(readlink -f /lib)
    mount -t overlay overlay -o "lowerdir=$planted:$lib" "$lib" || exit 77
fi
if [ -n "$replacement" ]; then
    for library in /lib/libpam.so.0 /lib/*/libpam.so.0; do
        [ ! -e "$library" ] || mount --bind "$replacement" "$(readlink -f "$library")"
    done
fi
exec "$@"
)sh";

int ExitStatus(pid_t child, bool kill_it) {
    if (kill_it)
        kill(child, SIGKILL);
    int status = 0;
    while (waitpid(child, &status, 0) < 0 && errno == EINTR) {
    }
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
}

// Each record is one write. False when the writers are not done in time.
bool ReadRecords(int socket, std::vector<std::string>& records) {
    constexpr int PATIENCE_MS = 100000;
    char record[65536];
    for (;;) {
        pollfd wait{.fd = socket, .events = POLLIN, .revents = 0};
        const int ready = poll(&wait, 1, PATIENCE_MS);
        if (ready < 0 && errno == EINTR)
            continue;
        if (ready <= 0)
            return false;
        const ssize_t size = recv(socket, record, sizeof record, 0);
        if (size <= 0)
            return size == 0;
        records.emplace_back(record, static_cast<std::size_t>(size));
    }
}

std::vector<std::string> NamespaceCommand() {
    std::vector<std::string> command{"unshare", "--mount"};
    if (!IsRoot())
        command.emplace_back("--map-root-user");
    return command;
}

}  // namespace

std::string HashOf(const std::string& password, const std::string& prefix) {
    constexpr unsigned long CHEAPEST_ROUNDS = 1000;
    const auto work = std::make_unique<crypt_data>();
    char setting[CRYPT_GENSALT_OUTPUT_SIZE];
    const unsigned long cost = prefix == "$y$" ? 1 : CHEAPEST_ROUNDS;
    if (crypt_gensalt_rn(prefix.c_str(), cost, nullptr, 0, setting, sizeof setting) == nullptr)
        return "no salt";
    const char* const hash = crypt_r(password.c_str(), setting, work.get());
    return hash != nullptr ? hash : "no hash";
}

bool IsRoot() {
    return getuid() == 0 && geteuid() == 0;
}

std::string FakePam(const std::string& without) {
    return std::string(OX_FAKE_PAM_DIRECTORY) + "/libfakepam" + (without.empty() ? "" : "_without_" + without) + ".so";
}

TestAccounts::TestAccounts() : m_passwd(PASSWD_START), m_shadow(SHADOW_START) {
    // Users other than the one who runs the test look in here.
    chmod(m_files.Path().c_str(), 0755);
    chmod(m_directory.Path().c_str(), 0777);
    m_files.Write("calls", "");
    chmod(m_files.File("calls").c_str(), 0666);
    m_files.Write("plan", "");
}

bool TestAccounts::Possible() {
    static const bool possible = [] {
        TestAccounts accounts;
        accounts.Add("probe", HashOf("probe"));
        return accounts.Run({"unix", "probe", "probe"}).lines == std::vector<std::string>{"1 0 ok"};
    }();
    return possible;
}

void TestAccounts::Add(const std::string& name, const std::string& passwdField,
                       const std::optional<std::string>& shadowField, bool expired) {
    AddPasswdLine(name + ":" + passwdField + ":4001:4001::/:/bin/sh");
    if (shadowField)
        AddShadowLine(name + ":" + *shadowField + ":19000:0:99999:7::" + (expired ? "1" : "") + ":");
}

HelperRun TestAccounts::Run(const std::vector<std::string>& steps) {
    m_files.Write("passwd", m_passwd);
    chmod(m_files.Write("shadow", m_shadow).c_str(), 0600);
    m_files.Write("group", GROUP);
    m_files.Write("nsswitch.conf", NAME_SERVICES);
    m_files.Write("pam.d/login", PAM_SERVICE);
    m_files.Write("security/group.conf", PAM_GROUPS);
    std::string planted;
    if (!m_planted.empty()) {
        planted = m_files.File("planted");
        std::filesystem::create_directory(planted);
        std::filesystem::copy_file(m_planted, planted + "/libpam.so");
    }
    std::vector<std::string> command = NamespaceCommand();
    command.insert(command.end(), {"sh", "-c", SCRIPT, "sh", m_files.Path(), planted, m_replacement, OX_ACCOUNT_CHECK});
    command.insert(command.end(), steps.begin(), steps.end());
    return Spawn(command);
}

HelperRun TestAccounts::RunPlainly(const std::vector<std::string>& steps) {
    std::vector<std::string> command{OX_ACCOUNT_CHECK};
    command.insert(command.end(), steps.begin(), steps.end());
    return Spawn(command);
}

HelperRun TestAccounts::Spawn(const std::vector<std::string>& command) {
    HelperRun run;
    int pair[2];
    if (socketpair(AF_UNIX, SOCK_SEQPACKET | SOCK_CLOEXEC, 0, pair) != 0)
        return run;
    const UniqueFd reader(pair[0]);
    UniqueFd writer(pair[1]);
    const std::string output = m_files.Write("output", "");

    std::vector<std::string> variables{"FAKEPAM_PLAN=" + m_files.File("plan"), "FAKEPAM_LOG=" + m_files.File("calls")};
    std::vector<char*> environment;
    for (char** variable = environ; *variable != nullptr; ++variable)
        environment.push_back(*variable);
    for (std::string& variable : variables)
        environment.push_back(variable.data());
    environment.push_back(nullptr);
    std::vector<std::string> texts = command;
    std::vector<char*> arguments;
    for (std::string& text : texts)
        arguments.push_back(text.data());
    arguments.push_back(nullptr);

    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, output.c_str(), O_WRONLY | O_APPEND, 0);
    posix_spawn_file_actions_adddup2(&actions, writer.Get(), STDERR_FILENO);
    posix_spawn_file_actions_addchdir_np(&actions, m_directory.Path().c_str());
    pid_t child = -1;
    const int error = posix_spawnp(&child, arguments[0], &actions, nullptr, arguments.data(), environment.data());
    posix_spawn_file_actions_destroy(&actions);
    if (error != 0)
        return run;
    writer.Reset();
    const bool done = ReadRecords(reader.Get(), run.errors);
    run.status = ExitStatus(child, !done);
    run.lines = m_files.Lines("output");
    return run;
}
