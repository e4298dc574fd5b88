/*
 * A mutex whose use Clang checks: fields say which lock guards them, procedures which lock they need, locks which other
 * locks may be taken while they are held (build with clang++ to have it checked; GCC ignores the marks). The table of
 * locks is in core/log_registry.h.
 */
#ifndef CORE_LOG_LOCK_H
#define CORE_LOG_LOCK_H

#include <chrono>
#include <condition_variable>
#include <mutex>

#if defined(__clang__)
#define LOG_CHECKED(attribute) __attribute__((attribute))
#else
#define LOG_CHECKED(attribute)
#endif

#define LOG_GUARDED_BY(lock) LOG_CHECKED(guarded_by(lock))
#define LOG_POINTEE_GUARDED_BY(lock) LOG_CHECKED(pt_guarded_by(lock))
#define LOG_REQUIRES(lock) LOG_CHECKED(requires_capability(lock))
#define LOG_ACQUIRED_BEFORE(...) LOG_CHECKED(acquired_before(__VA_ARGS__))

using log_clock = std::chrono::steady_clock;

class LOG_CHECKED(capability("mutex")) log_mutex
{
public:
    void acquire() LOG_CHECKED(acquire_capability()) { mutex_.lock(); }
    bool try_acquire() LOG_CHECKED(try_acquire_capability(true)) { return mutex_.try_lock(); }
    void release() LOG_CHECKED(release_capability()) { mutex_.unlock(); }

    /* Give the lock back while they wait for the condition, or until the time has come. */
    void wait(std::condition_variable &condition) LOG_CHECKED(requires_capability(this))
    {
        std::unique_lock<std::mutex> held{mutex_, std::adopt_lock};
        condition.wait(held);
        held.release();
    }
    void wait_until(std::condition_variable &condition, log_clock::time_point end)
        LOG_CHECKED(requires_capability(this))
    {
        std::unique_lock<std::mutex> held{mutex_, std::adopt_lock};
        condition.wait_until(held, end);
        held.release();
    }

private:
    std::mutex mutex_;
};

/* Holds a lock for as long as it lives. */
class LOG_CHECKED(scoped_lockable) log_lock
{
public:
    explicit log_lock(log_mutex &mutex) LOG_CHECKED(acquire_capability(mutex)) : mutex_(mutex) { mutex_.acquire(); }
    ~log_lock() LOG_CHECKED(release_capability()) { mutex_.release(); }
    log_lock(const log_lock &) = delete;
    log_lock &operator=(const log_lock &) = delete;

private:
    log_mutex &mutex_;
};

#endif
