// A PAM library that does what a plan says and records its calls.
//
// The file that FAKEPAM_PLAN names holds "key=value" lines, read at every call:
//   pam_start, pam_authenticate, pam_acct_mgmt, pam_setcred: what the function returns (0)
//   handle=null: pam_start gives no handle
//   ask=1,2: pam_authenticate asks with messages of these styles in one conversation
//   wait=FILE: pam_authenticate makes FILE.begun and goes on when FILE exists
//   groups=set, groups=init: pam_setcred calls setgroups, initgroups
// The calls are appended to the file that FAKEPAM_LOG names. Built with WITHOUT_<function>, it lacks that function.
#include <fcntl.h>
#include <grp.h>
#include <security/pam_appl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

struct pam_handle {
    pam_conv conversation;
};

namespace {

std::string Variable(const char* name) {
    const char* const value = std::getenv(name);
    return value != nullptr ? value : "";
}

std::string Planned(const std::string& key) {
    std::ifstream plan(Variable("FAKEPAM_PLAN"));
    for (std::string line; std::getline(plan, line);)
        if (line.starts_with(key + "="))
            return line.substr(key.size() + 1);
    return "";
}

int PlannedResult(const char* function) {
    return std::atoi(Planned(function).c_str());
}

void Record(const std::string& line) {
    std::ofstream(Variable("FAKEPAM_LOG"), std::ios::app) << line + "\n";
}

std::string User() {
    return " euid=" + std::to_string(geteuid());
}

[[maybe_unused]] int Ask(const pam_conv& conversation, const std::string& styles) {
    std::vector<pam_message> messages;
    std::istringstream list(styles);
    for (std::string style; std::getline(list, style, ',');)
        messages.push_back({std::atoi(style.c_str()), "?"});
    std::vector<const pam_message*> pointers;
    for (const pam_message& message : messages)
        pointers.push_back(&message);
    pam_response unset{};
    pam_response* answers = &unset;
    const int result =
        conversation.conv(static_cast<int>(pointers.size()), pointers.data(), &answers, conversation.appdata_ptr);
    std::string line = "conversation " + std::to_string(result) + ":";
    if (result != PAM_SUCCESS) {
        Record(line + (answers == nullptr ? " none" : " some"));
        return result;
    }
    for (std::size_t i = 0; i < messages.size(); ++i) {
        line += answers[i].resp != nullptr ? " [" + std::string(answers[i].resp) + "]" : " null";
        line += "/" + std::to_string(answers[i].resp_retcode);
        std::free(answers[i].resp);
    }
    std::free(answers);
    Record(line);
    return PAM_SUCCESS;
}

}  // namespace

extern "C" {

#ifndef WITHOUT_pam_start
int pam_start(const char* service, const char* user, const pam_conv* conversation, pam_handle_t** handle) {
    const bool plain = conversation->appdata_ptr == nullptr;
    Record(std::string("pam_start ") + service + " " + user + (plain ? "" : " with data") + User());
    *handle = Planned("handle") == "null" ? nullptr : new pam_handle{*conversation};
    return PlannedResult("pam_start");
}
#endif

#ifndef WITHOUT_pam_authenticate
int pam_authenticate(pam_handle_t* handle, int flags) {
    Record("pam_authenticate " + std::to_string(flags) + User());
    if (const std::string styles = Planned("ask"); !styles.empty())
        if (const int result = Ask(handle->conversation, styles); result != PAM_SUCCESS)
            return result;
    if (const std::string file = Planned("wait"); !file.empty()) {
        std::ofstream(file + ".begun") << "";
        while (access(file.c_str(), F_OK) != 0)
            usleep(1000);
    }
    return PlannedResult("pam_authenticate");
}
#endif

#ifndef WITHOUT_pam_acct_mgmt
int pam_acct_mgmt(pam_handle_t*, int flags) {
    Record("pam_acct_mgmt " + std::to_string(flags) + User());
    return PlannedResult("pam_acct_mgmt");
}
#endif

#ifndef WITHOUT_pam_setcred
int pam_setcred(pam_handle_t*, int flags) {
    Record("pam_setcred " + std::to_string(flags) + User());
    const gid_t groups[] = {7, 8};
    if (Planned("groups") == "set")
        Record("setgroups " + std::to_string(setgroups(2, groups)));
    if (Planned("groups") == "init")
        Record("initgroups " + std::to_string(initgroups("root", 9)));
    return PlannedResult("pam_setcred");
}
#endif

#ifndef WITHOUT_pam_end
int pam_end(pam_handle_t* handle, int status) {
    Record("pam_end " + std::to_string(status) + User());
    delete handle;
    return PAM_SUCCESS;
}
#endif

#ifndef WITHOUT_pam_strerror
const char* pam_strerror(pam_handle_t*, int error) {
    static char text[32];
    std::snprintf(text, sizeof text, "fake error %d", error);
    return text;
}
#endif

}  // extern "C"
