#include "platform/thread.h"

#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <exception>
#include <new>
#include <utility>

#include "platform/text.h"
#include "platform/threadcache.h"

// Sanitizers put several times the usual amount on the stack.
#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
#define OX_LARGE_STACK 1
#elif defined(__has_feature)
#if __has_feature(address_sanitizer) || __has_feature(thread_sanitizer) || __has_feature(memory_sanitizer)
#define OX_LARGE_STACK 1
#endif
#endif

namespace {

#ifdef OX_LARGE_STACK
constexpr std::size_t STACK_FACTOR = 8;
#else
constexpr std::size_t STACK_FACTOR = 1;
#endif

class ThreadAttributes {
public:
    ThreadAttributes() : m_error(pthread_attr_init(&m_attributes)) {}
    ~ThreadAttributes() {
        if (m_error == 0)
            pthread_attr_destroy(&m_attributes);
    }
    ThreadAttributes(const ThreadAttributes&) = delete;
    ThreadAttributes& operator=(const ThreadAttributes&) = delete;

    int Error() const { return m_error; }
    pthread_attr_t* Get() { return &m_attributes; }

private:
    pthread_attr_t m_attributes;
    const int m_error;
};

}  // namespace

std::string MThreadError::Text() const {
    return GetLastErrorText(m_code);
}

// The thread itself keeps its run alive, so the object may go as soon as `finished` is seen.
struct MThread::Run {
    Run(Entry body, void* bodyArgument) : entry(body), argument(bodyArgument) {}

    // The whole of the thread's work.
    void Do() {
        {
            const std::scoped_lock lock(mutex);
            id = CurrentId();
            changed.Broadcast();
        }
        try {
            entry(argument);
        } catch (...) {
            std::terminate();
        }
        const std::scoped_lock lock(mutex);
        finished = true;
        changed.Broadcast();
    }

    // Exactly one caller gets true, and joins or detaches the thread.
    bool ClaimJoin() {
        const std::scoped_lock lock(mutex);
        return !std::exchange(joinClaimed, true);
    }
    bool IsFinished() {
        const std::scoped_lock lock(mutex);
        return finished;
    }

    const Entry entry;
    void* const argument;
    pthread_t thread{};  // set by Create before it shows the run to others
    MMutex mutex;        // over all below
    MCondVar changed;
    unsigned id = 0;
    bool detached = false;
    bool finished = false;
    bool joinClaimed = false;
};

MThread::MThread(Priority priority, Kept kept) : m_priority(priority), m_kept(kept) {}

MThread::~MThread() {
    const std::shared_ptr<Run> run = CurrentRun();
    // The wait fails on the thread itself only.
    if (!Wait() && run->ClaimJoin())
        pthread_detach(run->thread);
}

void* MThread::Main(void* argument) {
    const std::unique_ptr<std::shared_ptr<Run>> holder(static_cast<std::shared_ptr<Run>*>(argument));
    (*holder)->Do();
    return nullptr;
}

int MThread::StartThread(pthread_t* thread, int detachState, void* (*entry)(void*), void* argument) {
    ThreadAttributes attributes;
    int error = attributes.Error();
    if (error == 0)
        error = pthread_attr_setstacksize(attributes.Get(), STACK_BYTES * STACK_FACTOR);
    if (error == 0)
        error = pthread_attr_setdetachstate(attributes.Get(), detachState);
    if (error == 0)
        error = pthread_create(thread, attributes.Get(), entry, argument);
    return error;
}

int MThread::Launch(const std::shared_ptr<Run>& run, Kept kept) {
    if (kept == Kept::Yes) {
        // Never destroyed: kept threads wait in it until the process is gone.
        static auto& cache = *new MThreadCache([](void* (*entry)(void*), void* argument) {
            pthread_t thread;
            return StartThread(&thread, PTHREAD_CREATE_DETACHED, entry, argument);
        });
        run->joinClaimed = true;  // there is no thread of its own to join
        return cache.Start([run] { run->Do(); });
    }
    auto holder = std::make_unique<std::shared_ptr<Run>>(run);
    const int error = StartThread(&run->thread, PTHREAD_CREATE_JOINABLE, &MThread::Main, holder.get());
    if (error == 0)
        static_cast<void>(holder.release());  // the thread's now
    return error;
}

bool MThread::Create(Entry entry, void* argument) {
    const std::scoped_lock lock(m_mutex);
    m_error = MThreadError();
    if (m_run) {
        if (!m_run->IsFinished()) {
            m_error = MThreadError(EBUSY);
            return false;
        }
        if (m_run->ClaimJoin())
            pthread_join(m_run->thread, nullptr);
    }
    m_cancelled.store(false);
    int error;
    try {
        const auto run = std::make_shared<Run>(entry, argument);
        error = Launch(run, m_kept);
        if (error == 0)
            m_run = run;
    } catch (const std::bad_alloc&) {
        error = ENOMEM;
    }
    m_error = MThreadError(error);
    return error == 0;
}

void MThread::Detach() {
    const std::shared_ptr<Run> run = CurrentRun();
    if (!run) {
        SetError(ESRCH);
        return;
    }
    bool before = false;
    {
        const std::scoped_lock lock(run->mutex);
        before = std::exchange(run->detached, true);
    }
    SetError(before ? EINVAL : 0);
}

bool MThread::Wait() {
    return WaitForRun(std::nullopt);
}

bool MThread::Wait(std::chrono::milliseconds limit) {
    return WaitForRun(limit);
}

bool MThread::WaitForRun(const std::optional<std::chrono::milliseconds>& limit) {
    SetError(0);
    const std::shared_ptr<Run> run = CurrentRun();
    if (!run)
        return true;
    {
        std::unique_lock lock(run->mutex);
        // Of an ended thread the kernel may have given the id to this one.
        if (!run->finished && run->id == CurrentId()) {
            lock.unlock();
            SetError(EDEADLK);
            return false;
        }
        const auto finished = [&run] { return run->finished; };
        if (!limit) {
            run->changed.Wait(lock, finished);
        } else if (!run->changed.WaitFor(lock, *limit, finished)) {
            lock.unlock();
            SetError(ETIMEDOUT);
            return false;
        }
    }
    // The object may be gone from here on when another thread waited for it too: only the run is touched.
    if (run->ClaimJoin())
        pthread_join(run->thread, nullptr);
    return true;
}

void MThread::Cancel() {
    const std::scoped_lock lock(m_pauseMutex);
    m_cancelled.store(true);
    m_pauseEnd.Broadcast();
}

bool MThread::Pause(std::chrono::milliseconds time) {
    std::unique_lock lock(m_pauseMutex);
    return !m_pauseEnd.WaitFor(lock, time, [this] { return m_cancelled.load(); });
}

bool MThread::IsRunning() const {
    const std::shared_ptr<Run> run = CurrentRun();
    return run && !run->IsFinished();
}

unsigned MThread::Id() const {
    const std::shared_ptr<Run> run = CurrentRun();
    if (!run)
        return 0;
    // The thread may not have come so far yet. Starting one does not wait for that: it would cost a switch each time.
    std::unique_lock lock(run->mutex);
    run->changed.Wait(lock, [&run] { return run->id != 0; });
    return run->id;
}

unsigned MThread::CurrentId() {
    thread_local unsigned id = 0;
    // A forked child runs on a copy of this thread's memory under another id.
    static std::once_flag prepared;
    std::call_once(prepared, [] { pthread_atfork(nullptr, nullptr, [] { id = 0; }); });
    if (id == 0)
        id = static_cast<unsigned>(gettid());
    return id;
}

MThreadError MThread::LastError() const {
    const std::scoped_lock lock(m_mutex);
    return m_error;
}

void MThread::Once(std::once_flag& flag, const std::function<void()>& function) {
    std::call_once(flag, function);
}

std::shared_ptr<MThread::Run> MThread::CurrentRun() const {
    const std::scoped_lock lock(m_mutex);
    return m_run;
}

void MThread::SetError(int code) {
    const std::scoped_lock lock(m_mutex);
    m_error = MThreadError(code);
}
