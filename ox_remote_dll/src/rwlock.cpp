#include "rwlock.h"

#include <pthread.h>

#include <cerrno>
#include <cstdint>
#include <ctime>

#include "platform/assertion.h"

// On the bare calls of the threads library, unlocked by hand: a cancelled thread leaves a wait through the clean-up
// handlers, which unlock the mutex, and a guard object would unlock it a second time.

namespace {
constexpr const char* SOURCE = "./ox_remote_dll/src/rwlock";
constexpr const char* READ_LOCK = "int RWLock::ReadLock()";
constexpr const char* READ_TRY_LOCK = "int RWLock::ReadTryLock()";
constexpr const char* READ_UNLOCK = "int RWLock::ReadUnlock()";
constexpr const char* WRITE_LOCK = "int RWLock::WriteLock()";
constexpr const char* WRITE_TRY_LOCK = "int RWLock::WriteTryLock()";
constexpr const char* WRITE_UNLOCK = "int RWLock::WriteUnlock()";
constexpr const char* READ_CLEANUP = "static void RWLock::ReadCleanup(void *)";
constexpr const char* WRITE_CLEANUP = "static void RWLock::WriteCleanup(void *)";
constexpr const char* DESTRUCTOR = "RWLock::~RWLock()";

constexpr int STATUS_NOT_UNLOCKED = -1;
constexpr long NANOSECONDS_PER_SECOND = 1000000000;

timespec SliceEnd() {
    timespec end{};
    clock_gettime(CLOCK_MONOTONIC, &end);
    const auto slice = std::chrono::nanoseconds(RWLock::GIVE_UP_INTERVAL).count();
    static_assert(slice < NANOSECONDS_PER_SECOND);
    end.tv_nsec += static_cast<long>(slice);
    if (end.tv_nsec >= NANOSECONDS_PER_SECOND) {
        end.tv_nsec -= NANOSECONDS_PER_SECOND;
        ++end.tv_sec;
    }
    return end;
}
}  // namespace

RWLock::RWLock() = default;

// Each wait is for the condition that the next release signals; with m_destroying set every change wakes both.
RWLock::~RWLock() {
    // A destructor must not be left by cancellation.
    int cancelState = 0;
    pthread_setcancelstate(PTHREAD_CANCEL_DISABLE, &cancelState);
    Enter(DESTRUCTOR);
    m_destroying = true;
    while (m_readers > 0 || m_writer || m_readersWaiting > 0 || m_writersWaiting > 0) {
        const bool forReaders = m_readers > 0 || (!m_writer && m_readersWaiting > 0);
        WaitOn(forReaders ? m_readOK : m_writeOK, nullptr, DESTRUCTOR);
    }
    m_bValid = 0;
    const int status = pthread_mutex_unlock(m_mutex.Native());
    if (status != 0)
        Fail(STATUS_NOT_UNLOCKED, &m_mutex, DESTRUCTOR);
    pthread_mutex_destroy(m_mutex.Native());
    pthread_setcancelstate(cancelState, nullptr);
}

void RWLock::CheckValid(const char* function) const {
    OX_ASSERT_AT(m_bValid == RWLOCK_VALID, "m_bValid == RWLOCK_VALID", SOURCE, __LINE__, function);
}

void RWLock::Fail(int status, const void* primitive, const char* function) {
    m_status = status;
    m_error = primitive;
    oxAssertionFailed("0", SOURCE, __LINE__, function);
}

void RWLock::Enter(const char* function) {
    CheckValid(function);
    const int status = pthread_mutex_lock(m_mutex.Native());
    if (status != 0)
        Fail(status, &m_mutex, function);
}

// The result is the operation's own: m_status is any thread's as soon as the mutex is free.
int RWLock::Leave(int status, const char* function) {
    m_status = status;
    if (pthread_mutex_unlock(m_mutex.Native()) != 0)
        Fail(STATUS_NOT_UNLOCKED, &m_mutex, function);
    return status;
}

// 0, perhaps without a cause, or ECANCELED.
int RWLock::WaitOn(MCondVar& condition, const GiveUp* giveUp, const char* function) {
    if (giveUp != nullptr && *giveUp) {
        if ((*giveUp)())
            return ECANCELED;
        WaitSliceOn(condition, function);
        return 0;
    }
    const int status = pthread_cond_wait(condition.Native(), m_mutex.Native());
    if (status != 0)
        Fail(status, &condition, function);
    return 0;
}

// Kept out of the plain wait: a cancelled thread leaves that one's frame in the middle, and AddressSanitizer takes the
// marks around a local variable that stay behind for an error.
[[gnu::noinline]] void RWLock::WaitSliceOn(MCondVar& condition, const char* function) {
    const timespec end = SliceEnd();
    const int status = pthread_cond_timedwait(condition.Native(), m_mutex.Native(), &end);
    if (status != 0 && status != ETIMEDOUT)
        Fail(status, &condition, function);
}

int RWLock::WakeDestructor() {
    if (!m_destroying)
        return 0;
    const int status = pthread_cond_broadcast(m_readOK.Native());
    return status != 0 ? status : pthread_cond_broadcast(m_writeOK.Native());
}

// After a waiting thread left without the lock: the wake-up it may have been given goes on. A writer that was woken,
// or the last of the readers that were woken before any writer, would else leave writers asleep at a free lock.
int RWLock::LeftWithoutLock() {
    if (!m_writer && m_readers <= 0 && m_readersWaiting == 0 && m_writersWaiting > 0) {
        const int status = pthread_cond_signal(m_writeOK.Native());
        if (status != 0)
            return status;
    }
    return WakeDestructor();
}

void RWLock::ReadCleanup(void* lock) {
    auto* const self = static_cast<RWLock*>(lock);
    --self->m_readersWaiting;
    if (const int status = self->LeftWithoutLock(); status != 0)
        self->Fail(status, &self->m_writeOK, READ_CLEANUP);
    if (pthread_mutex_unlock(self->m_mutex.Native()) != 0)
        self->Fail(STATUS_NOT_UNLOCKED, &self->m_mutex, READ_CLEANUP);
}

void RWLock::WriteCleanup(void* lock) {
    auto* const self = static_cast<RWLock*>(lock);
    --self->m_writersWaiting;
    if (const int status = self->LeftWithoutLock(); status != 0)
        self->Fail(status, &self->m_writeOK, WRITE_CLEANUP);
    if (pthread_mutex_unlock(self->m_mutex.Native()) != 0)
        self->Fail(STATUS_NOT_UNLOCKED, &self->m_mutex, WRITE_CLEANUP);
}

int RWLock::Read(const GiveUp* giveUp) {
    Enter(READ_LOCK);
    int status = 0;
    if (m_writer) {
        ++m_readersWaiting;
        pthread_cleanup_push(&ReadCleanup, this);
        while (status == 0 && m_writer)
            status = WaitOn(m_readOK, giveUp, READ_LOCK);
        pthread_cleanup_pop(0);
        --m_readersWaiting;
        if (status != 0)
            if (const int wake = LeftWithoutLock(); wake != 0)
                Fail(wake, &m_writeOK, READ_LOCK);
    }
    if (status == 0)
        ++m_readers;
    return Leave(status, READ_LOCK);
}

int RWLock::ReadLock() {
    return Read(nullptr);
}

int RWLock::ReadLock(const GiveUp& giveUp) {
    return Read(&giveUp);
}

int RWLock::ReadTryLock() {
    Enter(READ_TRY_LOCK);
    if (m_writer)
        return Leave(EBUSY, READ_TRY_LOCK);
    ++m_readers;
    return Leave(0, READ_TRY_LOCK);
}

int RWLock::ReadUnlock() {
    Enter(READ_UNLOCK);
    --m_readers;
    int status = 0;
    if (m_readers == 0 && m_writersWaiting > 0)
        status = pthread_cond_signal(m_writeOK.Native());
    if (status == 0)
        status = WakeDestructor();
    if (status != 0)
        Fail(status, &m_writeOK, READ_UNLOCK);
    return Leave(0, READ_UNLOCK);
}

int RWLock::Write(const GiveUp* giveUp) {
    Enter(WRITE_LOCK);
    int status = 0;
    if (m_writer || m_readers > 0) {
        ++m_writersWaiting;
        pthread_cleanup_push(&WriteCleanup, this);
        while (status == 0 && (m_writer || m_readers > 0))
            status = WaitOn(m_writeOK, giveUp, WRITE_LOCK);
        pthread_cleanup_pop(0);
        --m_writersWaiting;
        if (status != 0)
            if (const int wake = LeftWithoutLock(); wake != 0)
                Fail(wake, &m_writeOK, WRITE_LOCK);
    }
    if (status == 0)
        m_writer = true;
    return Leave(status, WRITE_LOCK);
}

int RWLock::WriteLock() {
    return Write(nullptr);
}

int RWLock::WriteLock(const GiveUp& giveUp) {
    return Write(&giveUp);
}

int RWLock::WriteTryLock() {
    CheckValid(WRITE_TRY_LOCK);
    const int locked = pthread_mutex_lock(m_mutex.Native());
    if (locked != 0) {
        // The one place that keeps an error number where the others keep the primitive.
        // NOLINTNEXTLINE(performance-no-int-to-ptr)
        Fail(locked, reinterpret_cast<const void*>(static_cast<std::intptr_t>(LastError())), WRITE_TRY_LOCK);
    }
    if (m_writer || m_readers > 0)
        return Leave(EBUSY, WRITE_TRY_LOCK);
    m_writer = true;
    return Leave(0, WRITE_TRY_LOCK);
}

// A wake-up that fails does not end the program here, other than in the rest of the class: it is the result.
int RWLock::WriteUnlock() {
    Enter(WRITE_UNLOCK);
    m_writer = false;
    int status = 0;
    if (m_readersWaiting > 0) {
        status = pthread_cond_broadcast(m_readOK.Native());
        if (status != 0)
            m_error = &m_readOK;
    } else if (m_writersWaiting > 0) {
        status = pthread_cond_signal(m_writeOK.Native());
        if (status != 0)
            m_error = &m_writeOK;
    }
    if (const int woken = WakeDestructor(); status == 0)
        status = woken;
    return Leave(status, WRITE_UNLOCK);
}

int RWLock::LastError() {
    return errno;
}

int RWLock::WaitingReaders() {
    const std::scoped_lock lock(m_mutex);
    return m_readersWaiting;
}

int RWLock::WaitingWriters() {
    const std::scoped_lock lock(m_mutex);
    return m_writersWaiting;
}
