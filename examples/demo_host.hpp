// What the demo's server program asks of its system, one small file for each
// (demo_host_posix.cpp, demo_host_win32.cpp).
#pragma once

#include <string>

namespace demo {

// Creates the file; false when it was there already.
bool create_marker(const char* path);
// Who we run as, for the operator: "uid 1000", or an account name on Windows.
std::string account();

} // namespace demo
