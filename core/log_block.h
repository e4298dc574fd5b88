/*
 * Memory for whole frames. A frame's records and buffers are too large for a stack that is thrown away with
 * its thread and too large to ask the allocator for at every frame, so blocks that were given back wait here
 * for the next taker, their pages already in place. For any thread.
 */
#ifndef CORE_LOG_BLOCK_H
#define CORE_LOG_BLOCK_H

#include <cstddef>
#include <memory>
#include <type_traits>

constexpr std::size_t kLogBlockSize = 128 * 1024;

/* A block of kLogBlockSize bytes, aligned to 64, holding whatever its last user left in it; null
 * without memory. */
void *log_block_take();

/* Gives a block back; null is passed over. */
void log_block_give(void *block);

struct log_block_deleter {
    void operator()(void *block) const { log_block_give(block); }
};

/* A record without constructor or destructor that lives in a block. */
template <typename Record> using log_block_ptr = std::unique_ptr<Record, log_block_deleter>;

template <typename Record> log_block_ptr<Record> log_block_of()
{
    static_assert(sizeof(Record) <= kLogBlockSize && std::is_trivial_v<Record>);
    return log_block_ptr<Record>{static_cast<Record *>(log_block_take())};
}

#endif
