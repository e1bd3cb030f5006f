#include "users/osuserbase.h"

#include <sys/utsname.h>
#include <unistd.h>

#include <cerrno>
#include <mutex>
#include <string_view>

#include "platform/config.h"
#include "platform/file.h"
#include "platform/text.h"
#include "support/logtext.h"
#include "users/authpam.h"
#include "users/authshadow.h"
#include "users/authunix.h"

namespace {

constexpr std::string_view DOMAIN_ENDS = "\\/";
constexpr std::string_view PAM = "pam";
constexpr std::string_view PASSWD = "passwd";
constexpr std::string_view SHADOW = "shadow";

// In one write, so that the lines of several threads stay whole.
void Report(const std::string& line) {
    WriteAll(STDERR_FILENO, line.data(), line.size());
}

// What follows the domain, which decides nothing.
std::string AccountOf(const std::string& name) {
    const auto end = name.find_first_of(DOMAIN_ENDS);
    return end == std::string::npos ? name : name.substr(end + 1);
}

bool HoldsNul(const std::string& text) {
    return text.find('\0') != std::string::npos;
}

bool Check(const oxAuthenticate& check, const char* failure) {
    if (!check.IsAuthenticated() && check.Error() != 0)
        Report(failure + (": " + check.Message()) + " (rc=" + std::to_string(check.Error()) + ")\n");
    return check.IsAuthenticated();
}

bool CheckAccount(const std::string& methods, const std::string& account, const std::string& password) {
    // The C library would check what stands before the NUL: another name, another password.
    if (HoldsNul(account) || HoldsNul(password))
        return false;
    const char* const user = account.c_str();
    const char* const secret = password.c_str();
    const auto enabled = [&](std::string_view method) { return methods.find(method) != std::string::npos; };
    if (enabled(PAM) && oxAuthPAM(user, secret).IsAuthenticated())
        return true;
    if (enabled(PASSWD) && Check(oxAuthUnix(user, secret), "UNIX passwd authentication failed"))
        return true;
    return enabled(SHADOW) && Check(oxAuthShadow(user, secret), "Shadow password authentication failed");
}

}  // namespace

std::string OSUserBase::Methods() {
    std::string text;
    oxConfig settings;
    if (!ReadWholeFile(m_pszSETTINGS_FILE, text)) {
        if (errno == ENOENT)
            return m_pszDEFAULT_METHODS;
    } else if (settings.OpenText(text)) {
        std::string methods =
            ToLower(settings.GetText(m_pszINI_SECTION_AUTHENTICATION, m_pszINI_KEY_METHODS, m_pszDEFAULT_METHODS));
        const std::scoped_lock lock(m_lock);
        m_lastMethods = methods;
        return methods;
    }
    const std::scoped_lock lock(m_lock);
    return m_lastMethods;
}

bool OSUserBase::Authenticate(const std::string& name, const std::string& password, std::uint32_t* /*permissions*/) {
    if (name.empty())
        return false;
    const std::string account = AccountOf(name);
    const std::string methods = Methods();
    utsname system;
    uname(&system);  // asked for with the settings; no method depends on the system's kind today
    if (CheckAccount(methods, account, password))
        return true;
    Report("User Authentication failed: " + LogText(account) + "\n");
    return false;
}

bool OSUserBase::AddUser(const std::string&, const std::string&, std::uint32_t, const std::string&,
                         const std::string&) {
    return false;
}

bool OSUserBase::DeleteUser(const std::string&) {
    return false;
}

bool OSUserBase::SetPermissions(const std::string&, std::uint32_t) {
    return false;
}

bool OSUserBase::SetPassword(const std::string&, const std::string&) {
    return false;
}

bool OSUserBase::SetText1(const std::string&, const std::string&) {
    return false;
}

bool OSUserBase::SetText2(const std::string&, const std::string&) {
    return false;
}

bool OSUserBase::GetPermissionsText(const std::string&, char*, std::size_t) {
    return false;
}
