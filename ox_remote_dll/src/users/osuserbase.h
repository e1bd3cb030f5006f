// The accounts of the operating system as users.
#pragma once

#include "users/userbase.h"

// Checks names and passwords with the methods that the settings file names ("methods" in section "authentication",
// read afresh for every check): PAM, then the passwd file, then the shadow file. The other operations answer false:
// accounts are not administered here. Failures are reported on standard error. Thread-safe.
class OSUserBase : public UserBase {
public:
    static constexpr const char* m_pszSETTINGS_FILE = "./ox_remote.ini";
    static constexpr const char* m_pszINI_SECTION_AUTHENTICATION = "authentication";
    static constexpr const char* m_pszINI_KEY_METHODS = "methods";
    static constexpr const char* m_pszDEFAULT_METHODS = "pam shadow passwd none";
    static constexpr std::size_t MAX_DOMAIN = 255;

    // A name "domain\account" or "domain/account" stands for the account.
    bool Authenticate(const std::string& name, const std::string& password, std::uint32_t* permissions) override;
    bool AddUser(const std::string&, const std::string&, std::uint32_t, const std::string&,
                 const std::string&) override;
    bool DeleteUser(const std::string&) override;
    bool SetPermissions(const std::string&, std::uint32_t) override;
    bool SetPassword(const std::string&, const std::string&) override;
    bool SetText1(const std::string&, const std::string&) override;
    bool SetText2(const std::string&, const std::string&) override;
    bool GetPermissionsText(const std::string&, char*, std::size_t) override;
};
