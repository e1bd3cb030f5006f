#include "users/authpam.h"

#include <security/pam_appl.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <new>

#include "platform/rootguard.h"
#include "platform/sharedlib.h"
#include "platform/text.h"
#include "users/groupguard.h"

namespace {

constexpr const char* UNDEFINED_ERROR = "Undefined PAM error";

// The functions of the library, from the first successful `Load` on.
struct Pam {
    // 0 or an error number. Only a failure is tried again.
    int Load(const char* path, const char* soname);

    decltype(&pam_start) start = nullptr;
    decltype(&pam_authenticate) authenticate = nullptr;
    decltype(&pam_acct_mgmt) acctMgmt = nullptr;
    decltype(&pam_setcred) setcred = nullptr;
    decltype(&pam_end) end = nullptr;
    decltype(&pam_strerror) strerror = nullptr;  // may be missing

private:
    int LookUpAll();
    template <typename Function>
    bool LookUp(const char* name, Function& function) {
        function = reinterpret_cast<Function>(m_library.Symbol(name));
        return function != nullptr;
    }

    MMutex m_loading;
    oxSharedLib m_library;
    bool m_loaded = false;
};

int Pam::LookUpAll() {
    errno = 0;
    if (!LookUp("pam_start", start) || !LookUp("pam_authenticate", authenticate) ||
        !LookUp("pam_acct_mgmt", acctMgmt) || !LookUp("pam_setcred", setcred) || !LookUp("pam_end", end))
        return errno != 0 ? errno : ENOSYS;
    LookUp("pam_strerror", strerror);
    return 0;
}

int Pam::Load(const char* path, const char* soname) {
    const std::scoped_lock lock(m_loading);
    if (m_loaded)
        return 0;
    struct stat status;
    const bool present = stat(path, &status) == 0;
    errno = 0;
    if (!m_library.Open(present ? path : soname))
        return errno != 0 ? errno : ENOENT;  // the loader does not always say
    const int error = LookUpAll();
    m_loaded = error == 0;
    if (!m_loaded)
        m_library.Close();
    return error;
}

// Never destroyed: a check may still run when the process exits.
Pam& ThePam() {
    alignas(Pam) static std::byte room[sizeof(Pam)];
    static Pam& pam = *new (room) Pam;
    return pam;
}

// One conversation with PAM, ended with the object.
class Dialogue {
public:
    explicit Dialogue(const Pam& pam) : m_pam(pam) {}
    ~Dialogue() {
        if (m_handle != nullptr)
            m_pam.end(m_handle, PAM_SUCCESS);
    }
    Dialogue(const Dialogue&) = delete;
    Dialogue& operator=(const Dialogue&) = delete;

    // The result of the last step that was taken.
    int Run(const char* user) {
        const pam_conv conversation{oxAuthPAM::Conversation, nullptr};
        int result = m_pam.start(oxAuthPAM::m_pszSERVICE, user, &conversation, &m_handle);
        if (result == PAM_SUCCESS)
            result = m_pam.authenticate(m_handle, PAM_DISALLOW_NULL_AUTHTOK);
        if (result == PAM_SUCCESS)
            result = m_pam.acctMgmt(m_handle, PAM_DISALLOW_NULL_AUTHTOK);
        if (result == PAM_SUCCESS)
            result = m_pam.setcred(m_handle, PAM_ESTABLISH_CRED);
        return result;
    }
    const char* ErrorText(int error) const {
        const char* const text = m_pam.strerror != nullptr ? m_pam.strerror(m_handle, error) : nullptr;
        return text != nullptr ? text : UNDEFINED_ERROR;
    }

private:
    const Pam& m_pam;
    pam_handle_t* m_handle = nullptr;
};

void FreeAnswers(pam_response* answers, int count) {
    for (int i = 0; i < count; ++i) {
        if (char* const text = answers[i].resp) {
            explicit_bzero(text, std::strlen(text));
            std::free(text);
        }
    }
    std::free(answers);
}

}  // namespace

MMutex oxAuthPAM::m_lock;
oxAuthPAM* oxAuthPAM::m_pCurrent = nullptr;
const char* oxAuthPAM::m_pszLibrary = m_pszLIBRARY;
const char* oxAuthPAM::m_pszLibrarySoname = m_pszLIBRARY_SONAME;

class oxAuthPAM::Current {
public:
    explicit Current(oxAuthPAM* check) { m_pCurrent = check; }
    ~Current() { m_pCurrent = nullptr; }
    Current(const Current&) = delete;
    Current& operator=(const Current&) = delete;
};

oxAuthPAM::oxAuthPAM(const char* user, const char* password) : oxAuthenticate(user, password) {
    if (user != nullptr && password != nullptr)
        oxAuthPAM::Authenticate(user, password);
}

bool oxAuthPAM::Authenticate(const char* user, const char* password) {
    if (!Begin(user, password))
        return false;
    Pam& pam = ThePam();
    if (const int error = pam.Load(m_pszLibrary, m_pszLibrarySoname); error != 0) {
        Fail(error, GetLastErrorText(error));
        return false;
    }
    const std::scoped_lock lock(m_lock);
    const Current current(this);
    const RootGuard root;  // where that fails, PAM decides what an ordinary user may ask
    const GroupGuard groups;
    Dialogue dialogue(pam);
    const int result = dialogue.Run(m_user);
    if (result != PAM_SUCCESS)
        Fail(result, dialogue.ErrorText(result));
    m_authenticated = result == PAM_SUCCESS;
    return m_authenticated;
}

int oxAuthPAM::Conversation(int num_msg, const pam_message** msg, pam_response** resp, void* /*appdata*/) {
    *resp = nullptr;
    if (num_msg <= 0)
        return PAM_CONV_ERR;
    auto* const answers =
        static_cast<pam_response*>(std::calloc(static_cast<std::size_t>(num_msg), sizeof(pam_response)));
    if (answers == nullptr)
        return PAM_CONV_ERR;
    for (int i = 0; i < num_msg; ++i) {
        const char* text = nullptr;
        bool known = true;
        switch (msg[i]->msg_style) {
            case PAM_PROMPT_ECHO_OFF:
                text = m_pCurrent != nullptr ? m_pCurrent->m_password : nullptr;
                break;
            case PAM_PROMPT_ECHO_ON:
                text = m_pCurrent != nullptr ? m_pCurrent->m_user : nullptr;
                break;
            case PAM_ERROR_MSG:
            case PAM_TEXT_INFO:
                break;
            default:
                known = false;
        }
        if (text != nullptr)
            answers[i].resp = strdup(text);
        if (!known || (text != nullptr && answers[i].resp == nullptr)) {
            FreeAnswers(answers, num_msg);
            return PAM_CONV_ERR;
        }
    }
    *resp = answers;
    return PAM_SUCCESS;
}
