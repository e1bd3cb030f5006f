// The user name and password of HTTP Basic authentication.
#pragma once

#include <string>
#include <string_view>

class oxCredentials {
public:
    // Longer pairs count as none.
    static constexpr std::size_t MAX_PAIR = 255;
    // The scheme word, compared with case.
    static constexpr std::string_view m_sBasicAuthHeader = "Basic";

    oxCredentials() = default;
    virtual ~oxCredentials() = default;

    void SetUser(const char* text) { m_user = text; }
    void SetPassword(const char* text) { m_password = text; }
    const std::string& GetUser() const { return m_user; }
    const std::string& GetPassword() const { return m_password; }

    // Takes both fields from the value of an Authorization header. Another scheme leaves them as they are; a pair that
    // is too long empties them. A pair without a colon is a user name with an empty password; the password may hold
    // colons.
    void ParseBasic(std::string_view headerValue);

protected:
    oxCredentials(const oxCredentials&) = default;
    oxCredentials& operator=(const oxCredentials&) = default;

private:
    std::string m_user;
    std::string m_password;
};
