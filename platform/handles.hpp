// What the seam hands out: the system's raw handle, an owner that closes it,
// and the Asio objects that a process holds for its pipes and its exit. The
// types are the system's own (platform/posix_types.hpp, win32_types.hpp);
// the code that holds them is the same on both.
#pragma once

#if defined(_WIN32)
#include "platform/win32_types.hpp"
#else
#include "platform/posix_types.hpp"
#endif

namespace torvad::platform {

void close_handle(native_handle handle);

// One open handle (a descriptor here, a HANDLE on Windows) and the duty to
// close it: gone with its owner unless released.
class owned_handle {
  public:
    owned_handle() = default;
    explicit owned_handle(native_handle handle) : handle_(handle) {}
    owned_handle(owned_handle&& other) noexcept : handle_(other.release()) {}
    owned_handle& operator=(owned_handle&& other) noexcept {
        reset(other.release());
        return *this;
    }
    owned_handle(const owned_handle&) = delete;
    owned_handle& operator=(const owned_handle&) = delete;
    ~owned_handle() { reset(); }

    native_handle get() const { return handle_; }
    bool valid() const { return handle_ != no_handle; }
    native_handle release() {
        native_handle handle = handle_;
        handle_ = no_handle;
        return handle;
    }
    void reset(native_handle handle = no_handle) {
        if (valid())
            close_handle(handle_);
        handle_ = handle;
    }

  private:
    native_handle handle_ = no_handle;
};

} // namespace torvad::platform
