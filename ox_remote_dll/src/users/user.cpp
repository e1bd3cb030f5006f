#include "users/user.h"

#include <string>

#include "platform/encrypt.h"

std::atomic<std::int32_t> oxUser::m_nTimeout{DEFAULT_TIMEOUT};

oxUser::oxUser(const oxClock& clock) : m_clock(clock), m_lastAccess(clock.Now()) {}

oxUser::~oxUser() {
    // The string is a part of this object, which is never const when it is destroyed.
    WipeText(const_cast<std::string&>(GetPassword()));
}

void oxUser::SetPermissions(std::uint32_t permissions) {
    m_permissions = permissions;
    Touch();
}

std::uint32_t oxUser::GetPermissions() {
    Touch();
    return m_permissions;
}

bool oxUser::IsExpired() {
    return m_nTimeout.load() + m_lastAccess < static_cast<std::int64_t>(m_clock.Now());
}

std::uint32_t oxUser::GetAttribute() {
    return m_attribute;
}

void oxUser::SetAttribute(std::uint32_t value) {
    m_attribute = value;
}

void oxUser::Touch() {
    m_lastAccess = m_clock.Now();
}
