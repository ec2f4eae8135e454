// Orphans on Windows: a process whose parent ends is nobody's to reap, so
// nothing is ever handed to us and nothing is watched.
#include "platform/platform.hpp"

namespace torvad::platform {

os_error watch_orphans(stream&) {
    return {};
}

bool reap_orphans(stream&) {
    return true;
}

} // namespace torvad::platform
