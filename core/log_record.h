/* Records that are too large for a stack: plain memory, whose lack is a result and no exception. */
#ifndef CORE_LOG_RECORD_H
#define CORE_LOG_RECORD_H

#include <cstddef>
#include <cstdlib>
#include <memory>
#include <type_traits>

struct log_free {
    void operator()(void *memory) const { std::free(memory); }
};

template <typename Record> using log_record_ptr = std::unique_ptr<Record, log_free>;

/* A record without constructor or destructor, aligned to 64 and holding anything; null without memory. */
template <typename Record> log_record_ptr<Record> log_allocate()
{
    constexpr std::size_t kAlignment = 64;
    static_assert(std::is_trivial_v<Record> && alignof(Record) <= kAlignment);
    constexpr std::size_t kSize = (sizeof(Record) + kAlignment - 1) / kAlignment * kAlignment;
    return log_record_ptr<Record>{static_cast<Record *>(std::aligned_alloc(kAlignment, kSize))};
}

#endif
