/* A descriptor that is closed with its owner. Moved, never copied; a plain int elsewhere only borrows. */
#ifndef PLATFORM_UNIQUE_FD_H
#define PLATFORM_UNIQUE_FD_H

#include <unistd.h>
#include <utility>

class unique_fd
{
public:
    unique_fd() = default;
    explicit unique_fd(int fd) : fd_(fd) {}
    unique_fd(unique_fd &&other) noexcept : fd_(other.release()) {}
    unique_fd &operator=(unique_fd &&other) noexcept
    {
        reset(other.release());
        return *this;
    }
    unique_fd(const unique_fd &) = delete;
    unique_fd &operator=(const unique_fd &) = delete;
    ~unique_fd() { reset(); }

    int get() const { return fd_; }
    explicit operator bool() const { return fd_ != -1; }

    /* Gives the descriptor away: the caller closes it. */
    [[nodiscard]] int release() { return std::exchange(fd_, -1); }

    void reset(int fd = -1)
    {
        if (fd_ != -1)
            close(fd_);
        fd_ = fd;
    }

private:
    int fd_ = -1;
};

#endif
