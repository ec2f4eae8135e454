// What both systems do the same way, through the C library and
// Boost.Filesystem: the PID file and paths.
#include "platform/platform.hpp"

#include <cstdio>

#include <boost/filesystem/operations.hpp>

namespace torvad::platform {

bool write_pid_file(const std::string& path, int pid) {
    // Binary: the line ends in a line feed alone, on Windows too.
    std::FILE* file = std::fopen(path.c_str(), "wb");
    if (file == nullptr)
        return false;
    std::fprintf(file, "%d\n", pid);
    return std::fclose(file) == 0;
}

void remove_file(const std::string& path) {
    std::remove(path.c_str());
}

std::string absolute_path(const std::string& path, os_error& error) {
    // An absolute name needs no current directory, which may have been deleted.
    if (boost::filesystem::path(path).is_absolute())
        return boost::filesystem::path(path).lexically_normal().string();
    boost::system::error_code failure;
    auto directory = boost::filesystem::current_path(failure);
    if (failure) {
        error = {failure.value(), "current_path"};
        return path;
    }
    return boost::filesystem::absolute(path, directory).lexically_normal().string();
}

bool path_exists(const std::string& path) {
    boost::system::error_code error;
    auto type = boost::filesystem::status(path, error).type();
    return type != boost::filesystem::status_error && type != boost::filesystem::file_not_found;
}

} // namespace torvad::platform
