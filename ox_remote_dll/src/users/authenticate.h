// The checks of a name and password against the accounts of the operating system.
#pragma once

#include <cstddef>
#include <string>

// Construct with a name and password: the check runs at once and its outcome stays in the object. Nothing throws, but
// for lack of memory.
//
// The fields hold 63 characters: a longer name or password fails instead of being checked cut short (a cut name could
// be somebody else).
class oxAuthenticate {
public:
    static constexpr std::size_t FIELD_SIZE = 64;

    // Null stands for the stored text; a given text becomes the stored one.
    virtual bool Authenticate(const char* user, const char* password) = 0;
    virtual ~oxAuthenticate();  // wipes the password
    oxAuthenticate(const oxAuthenticate&) = delete;
    oxAuthenticate& operator=(const oxAuthenticate&) = delete;

    bool IsAuthenticated() const { return m_authenticated; }
    int Error() const { return m_error; }                     // 0, an errno value or a PAM return code
    const std::string& Message() const { return m_message; }  // "ok", or the text of the error

protected:
    oxAuthenticate(const char* user, const char* password);

    // The start of every check: no outcome yet, and the given texts stored. False when a stored text was cut.
    bool Begin(const char* user, const char* password);
    void Fail(int error, const char* message);
    // Whether the password gives the hash. Fields that are no hash ("*", "!", a locked account's "!$6$...") match none.
    static bool Matches(const char* password, const char* hash);

    bool m_authenticated = false;
    char m_user[FIELD_SIZE] = {};
    char m_password[FIELD_SIZE] = {};
    int m_error = 0;
    std::string m_message = "ok";

private:
    void Store(const char* user, const char* password);

    bool m_userFits = true;
    bool m_passwordFits = true;
};
