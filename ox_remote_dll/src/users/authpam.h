// PAM.
#pragma once

#include "platform/mutex.h"
#include "users/authenticate.h"

struct pam_message;
struct pam_response;

// One check at a time in the process: PAM asks back for the name and password through `m_pCurrent`. Raises its thread
// to root for the check, and undoes what modules do to the thread's groups. The library is loaded at the first check
// and stays loaded: its modules may leave threads and handlers behind.
class oxAuthPAM : public oxAuthenticate {
public:
    static constexpr const char* m_pszSERVICE = "login";
    static constexpr const char* m_pszLIBRARY = "/lib/libpam.so";      // one that the administrator put there
    static constexpr const char* m_pszLIBRARY_SONAME = "libpam.so.0";  // the system's, where there is no such file

    oxAuthPAM(const char* user, const char* password);
    bool Authenticate(const char* user, const char* password) override;

    // Called by PAM on the thread of the check. The answers are the caller's to free.
    static int Conversation(int num_msg, const pam_message** msg, pam_response** resp, void* appdata);

protected:
    // What is loaded. A test names libraries of its own before the first check.
    static const char* m_pszLibrary;
    static const char* m_pszLibrarySoname;

private:
    class Current;

    static MMutex m_lock;
    static oxAuthPAM* m_pCurrent;  // whose check runs
};
