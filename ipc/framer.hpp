// Cuts the byte stream of an ipc pipe into packets, in place in one buffer of
// the largest packet's size. The framer owns its buffer; reads put their
// bytes at free_space() and hand the count to add().
#pragma once

#include <cstddef>
#include <cstring>
#include <memory>

#include "ipc/packet.hpp"

namespace torvad {

class framer {
  public:
    framer() : buffer_(new char[packet_max_size]) {}

    // Where the next read may put its bytes, and how many fit there.
    char* free_space() { return buffer_.get() + fill_; }
    std::size_t free_size() const { return packet_max_size - fill_; }
    // Bytes held that don't make a whole packet yet.
    std::size_t held() const { return fill_; }
    const char* data() const { return buffer_.get(); }

    // Takes the bytes a read just put at free_space() and calls
    // on_packet(header, payload) for each whole packet, in order. A length
    // outside 16..65536 can't be trusted to find the next packet, so
    // on_bad_length() is called once and every byte held is dropped.
    template <class OnPacket, class OnBadLength>
    void add(std::size_t bytes, OnPacket&& on_packet, OnBadLength&& on_bad_length);

  private:
    std::unique_ptr<char[]> buffer_;
    std::size_t fill_ = 0;
};

template <class OnPacket, class OnBadLength>
void framer::add(std::size_t bytes, OnPacket&& on_packet, OnBadLength&& on_bad_length) {
    fill_ += bytes;
    std::size_t offset = 0;
    while (fill_ - offset >= packet_header_size) {
        const char* packet = buffer_.get() + offset;
        packet_header header = read_packet_header(packet);
        if (!valid_packet_length(header.length)) {
            fill_ = 0;
            on_bad_length();
            return;
        }
        if (header.length > fill_ - offset)
            break;
        offset += header.length;
        on_packet(header, packet + packet_header_size);
    }
    // One move of the unfinished tail, however many packets came in this read.
    fill_ -= offset;
    if (offset != 0 && fill_ != 0)
        std::memmove(buffer_.get(), buffer_.get() + offset, fill_);
}

} // namespace torvad
