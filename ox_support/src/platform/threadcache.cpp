#include "platform/threadcache.h"

#include <algorithm>
#include <cerrno>
#include <memory>
#include <new>
#include <utility>

struct MThreadCache::Worker {
    Worker(MThreadCache& owner, Work first) : cache(owner), work(std::move(first)) {}

    MThreadCache& cache;
    Work work;  // empty while waiting; guarded by the cache's mutex
    MCondVar wakeup;
};

int MThreadCache::Start(Work work) {
    try {
        {
            const std::scoped_lock lock(m_mutex);
            m_idle.reserve(MAX_IDLE);  // so that keeping a thread never allocates
            if (!m_idle.empty()) {
                Worker* const worker = m_idle.back();
                m_idle.pop_back();
                worker->work = std::move(work);
                worker->wakeup.Signal();
                return 0;
            }
        }
        auto worker = std::make_unique<Worker>(*this, std::move(work));
        const int error = m_starter(&MThreadCache::CallWorker, worker.get());
        if (error == 0)
            static_cast<void>(worker.release());  // the thread's now
        return error;
    } catch (const std::bad_alloc&) {
        return ENOMEM;
    }
}

std::size_t MThreadCache::IdleCount() {
    const std::scoped_lock lock(m_mutex);
    return m_idle.size();
}

void* MThreadCache::CallWorker(void* argument) {
    const std::unique_ptr<Worker> worker(static_cast<Worker*>(argument));
    do {
        std::exchange(worker->work, nullptr)();
    } while (worker->cache.AwaitWork(*worker));
    return nullptr;
}

bool MThreadCache::AwaitWork(Worker& worker) {
    std::unique_lock lock(m_mutex);
    if (m_idle.size() >= MAX_IDLE)
        return false;
    m_idle.push_back(&worker);
    if (worker.wakeup.WaitFor(lock, IDLE_TIME, [&worker] { return static_cast<bool>(worker.work); }))
        return true;
    m_idle.erase(std::find(m_idle.begin(), m_idle.end(), &worker));
    return false;
}
