#include "platform/thread.h"

#include <pthread.h>
#include <unistd.h>

#include <cerrno>
#include <exception>
#include <new>
#include <utility>

#include "platform/text.h"

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

MThread::MThread(Priority priority) : m_priority(priority) {}

MThread::~MThread() {
    const std::shared_ptr<Run> run = CurrentRun();
    // The wait fails on the thread itself only.
    if (!Wait() && run->ClaimJoin())
        pthread_detach(run->thread);
}

void* MThread::Main(void* argument) {
    const std::unique_ptr<std::shared_ptr<Run>> holder(static_cast<std::shared_ptr<Run>*>(argument));
    Run& run = **holder;
    {
        const std::scoped_lock lock(run.mutex);
        run.id = CurrentId();
        run.changed.Broadcast();
    }
    try {
        run.entry(run.argument);
    } catch (...) {
        std::terminate();
    }
    const std::scoped_lock lock(run.mutex);
    run.finished = true;
    run.changed.Broadcast();
    return nullptr;
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
    ThreadAttributes attributes;
    int error = attributes.Error();
    if (error == 0)
        error = pthread_attr_setstacksize(attributes.Get(), STACK_BYTES * STACK_FACTOR);
    std::unique_ptr<std::shared_ptr<Run>> holder;
    try {
        holder = std::make_unique<std::shared_ptr<Run>>(std::make_shared<Run>(entry, argument));
    } catch (const std::bad_alloc&) {
        m_error = MThreadError(ENOMEM);
        return false;
    }
    const std::shared_ptr<Run> run = *holder;
    m_cancelled.store(false);
    if (error == 0)
        error = pthread_create(&run->thread, attributes.Get(), &MThread::Main, holder.get());
    if (error != 0) {
        m_error = MThreadError(error);
        return false;
    }
    static_cast<void>(holder.release());  // the thread's now
    m_run = run;
    return true;
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
    m_cancelled.store(true);
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
    return static_cast<unsigned>(gettid());
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
