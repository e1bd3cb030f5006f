#include "bridge/support_failures.h"

#include <pthread.h>
#include <sys/types.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>

namespace {
struct Plan {
    bool active = false;
    FailingCall call = FailingCall::System;
    long systemCall = 0;
    int error = 0;
    int passing = 0;
};
thread_local Plan plan;
std::atomic<long> waitPidCalls{0};

// The error number, or 0 when the call is to pass.
int Error(FailingCall call, long systemCall = 0) {
    if (!plan.active || plan.call != call || plan.systemCall != systemCall || plan.passing-- > 0)
        return 0;
    plan.active = false;
    return plan.error;
}
}  // namespace

FailsOnce::FailsOnce(FailingCall call, long systemCall, int error, int passing) {
    plan = {true, call, systemCall, error, passing};
}

FailsOnce::~FailsOnce() {
    plan.active = false;
}

bool FailsOnce::HasFailed() {
    return !plan.active;
}

long WaitPidCalls() {
    return waitPidCalls;
}

extern "C" {
int __real_pthread_mutex_lock(pthread_mutex_t*);
int __real_pthread_mutex_unlock(pthread_mutex_t*);
int __real_pthread_cond_wait(pthread_cond_t*, pthread_mutex_t*);
int __real_pthread_cond_signal(pthread_cond_t*);
int __real_pthread_cond_broadcast(pthread_cond_t*);
pid_t __real_waitpid(pid_t, int*, int);
char* __real_strdup(const char*);
long __real_syscall(long, ...);

int __wrap_pthread_mutex_lock(pthread_mutex_t*);
int __wrap_pthread_mutex_unlock(pthread_mutex_t*);
int __wrap_pthread_cond_wait(pthread_cond_t*, pthread_mutex_t*);
int __wrap_pthread_cond_signal(pthread_cond_t*);
int __wrap_pthread_cond_broadcast(pthread_cond_t*);
pid_t __wrap_waitpid(pid_t, int*, int);
char* __wrap_strdup(const char*);
long __wrap_syscall(long, ...);
}

int __wrap_pthread_mutex_lock(pthread_mutex_t* mutex) {
    const int error = Error(FailingCall::MutexLock);
    return error != 0 ? error : __real_pthread_mutex_lock(mutex);
}

int __wrap_pthread_mutex_unlock(pthread_mutex_t* mutex) {
    const int error = Error(FailingCall::MutexUnlock);
    return error != 0 ? error : __real_pthread_mutex_unlock(mutex);
}

int __wrap_pthread_cond_wait(pthread_cond_t* condition, pthread_mutex_t* mutex) {
    const int error = Error(FailingCall::CondWait);
    return error != 0 ? error : __real_pthread_cond_wait(condition, mutex);
}

int __wrap_pthread_cond_signal(pthread_cond_t* condition) {
    const int error = Error(FailingCall::CondSignal);
    return error != 0 ? error : __real_pthread_cond_signal(condition);
}

int __wrap_pthread_cond_broadcast(pthread_cond_t* condition) {
    const int error = Error(FailingCall::CondBroadcast);
    return error != 0 ? error : __real_pthread_cond_broadcast(condition);
}

pid_t __wrap_waitpid(pid_t pid, int* status, int options) {
    ++waitPidCalls;
    if (const int error = Error(FailingCall::WaitPid); error != 0) {
        errno = error;
        return -1;
    }
    return __real_waitpid(pid, status, options);
}

char* __wrap_strdup(const char* text) {
    return Error(FailingCall::DuplicateText) != 0 ? nullptr : __real_strdup(text);
}

// Hands on as many values as the call can have, also those that the caller did not give.
__attribute__((no_sanitize("address"))) long __wrap_syscall(long number, ...) {
    if (const int error = Error(FailingCall::System, number); error != 0) {
        errno = error;
        return -1;
    }
    constexpr int ARGUMENTS = 6;
    long values[ARGUMENTS];
    va_list arguments;
    va_start(arguments, number);
    for (long& value : values)
        value = va_arg(arguments, long);
    va_end(arguments);
    return __real_syscall(number, values[0], values[1], values[2], values[3], values[4], values[5]);
}
