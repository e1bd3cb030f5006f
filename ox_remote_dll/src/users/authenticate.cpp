#include "users/authenticate.h"

#include <crypt.h>

#include <cstring>
#include <memory>

#include "platform/text.h"

namespace {

// Whether all of the text fits.
bool StoreField(char (&field)[oxAuthenticate::FIELD_SIZE], const char* text) {
    explicit_bzero(field, sizeof field);
    return CopyText(field, sizeof field, text);
}

}  // namespace

oxAuthenticate::oxAuthenticate(const char* user, const char* password) {
    Store(user, password);
}

oxAuthenticate::~oxAuthenticate() {
    explicit_bzero(m_password, sizeof m_password);
}

void oxAuthenticate::Store(const char* user, const char* password) {
    if (user != nullptr)
        m_userFits = StoreField(m_user, user);
    if (password != nullptr)
        m_passwordFits = StoreField(m_password, password);
}

bool oxAuthenticate::Begin(const char* user, const char* password) {
    m_authenticated = false;
    m_error = 0;
    m_message = "ok";
    Store(user, password);
    return m_userFits && m_passwordFits;
}

void oxAuthenticate::Fail(int error, const char* message) {
    m_error = error;
    m_message = message;
}

bool oxAuthenticate::Matches(const char* password, const char* hash) {
    const auto work = std::make_unique<crypt_data>();  // too large for a stack
    const char* const result = crypt_r(password, hash, work.get());
    // A leading "*" is how a hash that cannot be computed comes back.
    const bool matches = result != nullptr && result[0] != '*' && std::strcmp(result, hash) == 0;
    explicit_bzero(work.get(), sizeof *work);
    return matches;
}
