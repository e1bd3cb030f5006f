// The accounts of the operating system as users.
#pragma once

#include <string>

#include "platform/mutex.h"
#include "users/userbase.h"

// Checks names and passwords with the methods that the settings file names ("methods" in section "authentication",
// read afresh for every check): PAM, then the passwd file, then the shadow file. The other operations answer false:
// accounts are not administered here. Failures are reported on standard error. Thread-safe.
//
// A method counts as named wherever its name stands in the text. Without a settings file all methods are tried; a file
// that is there but cannot be read leaves the methods that were last read in force, so that a lack of descriptors or of
// permission does not switch methods on.
class OSUserBase : public UserBase {
public:
    static constexpr const char* m_pszSETTINGS_FILE = "./ox_remote.ini";
    static constexpr const char* m_pszINI_SECTION_AUTHENTICATION = "authentication";
    static constexpr const char* m_pszINI_KEY_METHODS = "methods";
    static constexpr const char* m_pszDEFAULT_METHODS = "pam shadow passwd none";

    // A name "domain\account" or "domain/account" stands for the account. Accounts have no permissions of their own:
    // the caller's are left alone.
    bool Authenticate(const std::string& name, const std::string& password, std::uint32_t* permissions) override;
    bool AddUser(const std::string&, const std::string&, std::uint32_t, const std::string&,
                 const std::string&) override;
    bool DeleteUser(const std::string&) override;
    bool SetPermissions(const std::string&, std::uint32_t) override;
    bool SetPassword(const std::string&, const std::string&) override;
    bool SetText1(const std::string&, const std::string&) override;
    bool SetText2(const std::string&, const std::string&) override;
    bool GetPermissionsText(const std::string&, char*, std::size_t) override;

private:
    std::string Methods();

    MMutex m_lock;
    std::string m_lastMethods = m_pszDEFAULT_METHODS;
};
