/*
 * A mutex whose use Clang checks: fields say which lock guards them, procedures which lock they need (build
 * with clang++ to have it checked; GCC ignores the marks). The locks of the daemon, and what never happens
 * under them, stand in core/log_registry.h.
 */
#ifndef CORE_LOG_LOCK_H
#define CORE_LOG_LOCK_H

#include <mutex>
#include <pthread.h>

#if defined(__clang__)
#define LOG_CHECKED(attribute) __attribute__((attribute))
#else
#define LOG_CHECKED(attribute)
#endif

#define LOG_GUARDED_BY(lock) LOG_CHECKED(guarded_by(lock))
#define LOG_REQUIRES(lock) LOG_CHECKED(requires_capability(lock))

class LOG_CHECKED(capability("mutex")) log_mutex
{
public:
    void acquire() LOG_CHECKED(acquire_capability()) { mutex_.lock(); }
    bool try_acquire() LOG_CHECKED(try_acquire_capability(true)) { return mutex_.try_lock(); }
    void release() LOG_CHECKED(release_capability()) { mutex_.unlock(); }

    /* Gives the lock back while it waits for the condition, which is never destroyed. */
    void wait(pthread_cond_t &condition) LOG_CHECKED(requires_capability(this))
    {
        pthread_cond_wait(&condition, mutex_.native_handle());
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
