#include <windows.h>

#include "examples/demo_host.hpp"

namespace demo {

bool create_marker(const char* path) {
    HANDLE marker =
        CreateFileA(path, GENERIC_WRITE, 0, nullptr, CREATE_NEW, FILE_ATTRIBUTE_NORMAL, nullptr);
    if (marker == INVALID_HANDLE_VALUE)
        return false;
    CloseHandle(marker);
    return true;
}

std::string account() {
    char name[256];
    DWORD size = sizeof name;
    if (!GetUserNameA(name, &size))
        return "an unknown account";
    return name;
}

} // namespace demo
