#include <fcntl.h>
#include <unistd.h>

#include "examples/demo_host.hpp"

namespace demo {

bool create_marker(const char* path) {
    int marker = open(path, O_CREAT | O_EXCL | O_WRONLY, 0644);
    if (marker == -1)
        return false;
    close(marker);
    return true;
}

std::string account() {
    return "uid " + std::to_string(getuid());
}

} // namespace demo
