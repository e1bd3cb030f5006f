// What every source of users offers.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

// All operations may be called from several threads at once; each is false for a missing user, a refused value or a
// failure, and then has changed nothing.
class UserBase {
public:
    virtual ~UserBase() = default;

    // The permissions are filled in on success, unless null.
    virtual bool Authenticate(const std::string& name, const std::string& password,
                              std::uint32_t* permissions = nullptr) = 0;
    virtual bool AddUser(const std::string& name, const std::string& password, std::uint32_t permissions,
                         const std::string& maxProfiles, const std::string& logFileUrl) = 0;
    virtual bool DeleteUser(const std::string& name) = 0;
    virtual bool SetPermissions(const std::string& name, std::uint32_t permissions) = 0;
    virtual bool SetPassword(const std::string& name, const std::string& password) = 0;
    virtual bool SetText1(const std::string& name, const std::string& text) = 0;  // the log file URL
    virtual bool SetText2(const std::string& name, const std::string& text) = 0;  // the most profiles, in decimal
    // Appends "permissions=N" to the NUL-terminated text in a buffer of the given size.
    virtual bool GetPermissionsText(const std::string& name, char* buffer, std::size_t size) = 0;
};
