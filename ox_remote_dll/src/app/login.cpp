// Who a user is: the product's own user files, or the accounts of the operating system.
#include <cstdio>

#include "app/oxxhttpserver.h"
#include "support/logtext.h"

bool oxxHttpServer::AuthenticateUser(oxUser& user, UserCheck check) {
    const std::string name = LogText(user.GetUser());
    MessageLog().Log(3, "Authenticating user %s...", name.c_str());
    std::uint32_t permissions = 0;
    if (Setup()->osAuthentication) {
        // The account proves the password, the user file gives the permissions: both must exist.
        if (m_oxxUserBase.FindUser(user.GetUser(), &permissions)) {
            user.SetPermissions(permissions);
            return CheckOperatingSystem(user, check);
        }
    } else if (m_oxxUserBase.Authenticate(user.GetUser(), user.GetPassword(), &permissions)) {
        user.SetPermissions(permissions);
        MessageLog().Log(2, "User %s Authenticated", name.c_str());
        return true;
    }
    MessageLog().Log(2, "Authentication failed: user %s.", name.c_str());
    return false;
}

bool oxxHttpServer::CheckOperatingSystem(oxUser& user, UserCheck check) {
    if (user.GetUser() == sANONYMOUS)
        return true;  // has no account
    const std::string name = LogText(user.GetUser());
    if (check == UserCheck::Full) {
        const std::string login = LoginName(Setup()->ntDomain, user.GetUser());
        if (!m_OSUserBase.Authenticate(login, user.GetPassword(), nullptr)) {
            MessageLog().Log(2, "User %s authentication failed.", name.c_str());
            return false;
        }
    }
    MessageLog().Log(2, "User %s authenticated.", name.c_str());
    return true;
}

std::string oxxHttpServer::LoginName(const std::string& domain, const std::string& user) {
    char login[LOGIN_NAME_BUFFER] = {};
    std::snprintf(login, sizeof login, "%s%s%s", domain.c_str(), domain.empty() ? "" : "/", user.c_str());
    return login;
}
