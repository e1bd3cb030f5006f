// A signed-in user.
#pragma once

#include <atomic>
#include <cstdint>

#include "platform/clock.h"
#include "protocol/credentials.h"

// Credentials, permissions and the time of the last use. No lock of its own: the owner serialises access.
class oxUser : public oxCredentials {
public:
    static constexpr std::int32_t DEFAULT_TIMEOUT = 60;
    // The idle time-out of all users, in seconds; set when the server is configured.
    static std::atomic<std::int32_t> m_nTimeout;

    explicit oxUser(const oxClock& clock = oxClock::System());  // in use from now on
    ~oxUser() override;                                         // wipes the password

    virtual void SetPermissions(std::uint32_t permissions);  // counts as use
    virtual std::uint32_t GetPermissions();                  // counts as use
    // Longer ago than the time-out; exactly that long ago is not yet expired.
    virtual bool IsExpired();
    virtual std::uint32_t GetAttribute();  // no rule of its own
    virtual void SetAttribute(std::uint32_t value);
    virtual void Touch();

private:
    const oxClock& m_clock;
    std::int64_t m_lastAccess;  // seconds since the epoch
    std::uint32_t m_permissions = 0;
    std::uint32_t m_attribute = 0;
};
