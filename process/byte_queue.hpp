// A queue of bytes waiting for a pipe, kept in fixed blocks that are reused,
// so that a queued packet costs no allocation of its own and the front of the
// queue goes out in one gathered write. An empty queue holds no memory.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include <boost/asio/buffer.hpp>

namespace torvad {

class byte_queue {
  public:
    static constexpr std::size_t block_size = 64 * 1024;
    // The most buffers one gathered write takes from the front.
    static constexpr std::size_t max_gather = 16;

    void push(const void* data, std::size_t size);
    // One packet, its header encoded in place.
    void push_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                     const void* data, std::size_t size);
    // The front of the queue as buffers for one write (unused ones empty); the
    // bytes stay queued, in place, until consume() drops them.
    using buffers = std::array<boost::asio::const_buffer, max_gather>;
    buffers front() const;
    void consume(std::size_t bytes);
    void clear();
    std::size_t size() const { return size_; }
    bool empty() const { return size_ == 0; }

  private:
    struct block {
        std::unique_ptr<char[]> data;
        std::size_t begin = 0, end = 0;
    };
    char* room(std::size_t& available);

    std::vector<block> blocks_;
    std::unique_ptr<char[]> spare_; // one emptied block kept while the queue is busy
    std::size_t size_ = 0;
};

} // namespace torvad
