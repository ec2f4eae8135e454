// Blocks are filled at the back and emptied at the front; a packet may span two.
#include "process/byte_queue.hpp"

#include <algorithm>
#include <cstring>

#include "ipc/packet.hpp"

namespace torvad {

char* byte_queue::room(std::size_t& available) {
    if (blocks_.empty() || blocks_.back().end == block_size) {
        block fresh;
        // Not zeroed: every byte is written before it is read, and a block
        // touches only the pages that a queue fills.
        fresh.data =
            spare_ ? std::move(spare_) : std::make_unique_for_overwrite<char[]>(block_size);
        blocks_.push_back(std::move(fresh));
    }
    block& last = blocks_.back();
    available = block_size - last.end;
    return last.data.get() + last.end;
}

void byte_queue::push(const void* data, std::size_t size) {
    const char* bytes = static_cast<const char*>(data);
    size_ += size;
    while (size != 0) {
        std::size_t available = 0;
        char* out = room(available);
        std::size_t taken = std::min(available, size);
        std::memcpy(out, bytes, taken);
        blocks_.back().end += taken;
        bytes += taken;
        size -= taken;
    }
}

void byte_queue::push_packet(std::uint32_t channel, std::uint32_t type, std::uint32_t flags,
                             const void* data, std::size_t size) {
    unsigned char header[packet_header_size];
    write_packet_header(
        header, {static_cast<std::uint32_t>(size + packet_header_size), channel, type, flags});
    push(header, sizeof header);
    if (size != 0)
        push(data, size);
}

byte_queue::buffers byte_queue::front() const {
    buffers out;
    std::size_t count = std::min(blocks_.size(), max_gather);
    for (std::size_t i = 0; i < count; ++i)
        out[i] = boost::asio::buffer(blocks_[i].data.get() + blocks_[i].begin,
                                     blocks_[i].end - blocks_[i].begin);
    return out;
}

void byte_queue::consume(std::size_t bytes) {
    bytes = std::min(bytes, size_);
    size_ -= bytes;
    std::size_t emptied = 0;
    while (bytes != 0) {
        block& first = blocks_[emptied];
        std::size_t taken = std::min(bytes, first.end - first.begin);
        first.begin += taken;
        bytes -= taken;
        if (first.begin == first.end)
            ++emptied;
    }
    for (std::size_t i = 0; i < emptied; ++i)
        if (!spare_)
            spare_ = std::move(blocks_[i].data);
    blocks_.erase(blocks_.begin(), blocks_.begin() + static_cast<std::ptrdiff_t>(emptied));
    // An idle queue gives its memory back: a thousand idle channels must not
    // each keep a block.
    if (size_ == 0)
        clear();
}

void byte_queue::clear() {
    std::vector<block>().swap(blocks_);
    spare_.reset();
    size_ = 0;
}

} // namespace torvad
