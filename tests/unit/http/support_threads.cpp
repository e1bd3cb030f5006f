#include "http/support_threads.h"

#include <pthread.h>

#include <atomic>

namespace {
std::atomic<int> failure{0};
}

extern "C" int __real_pthread_create(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*);
extern "C" int __wrap_pthread_create(pthread_t*, const pthread_attr_t*, void* (*)(void*), void*);

int __wrap_pthread_create(pthread_t* thread, const pthread_attr_t* attributes, void* (*entry)(void*), void* argument) {
    const int error = failure;
    return error != 0 ? error : __real_pthread_create(thread, attributes, entry, argument);
}

FailingThreads::FailingThreads(int error) {
    failure = error;
}

void FailingThreads::End() {
    failure = 0;
}
