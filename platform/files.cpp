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

const std::vector<std::string>& script_wrapper() {
    static const std::vector<std::string> wrapper = {
        "powershell", "-noprofile", "-noninteractive", "-executionpolicy", "bypass", "-file"};
    return wrapper;
}

os_error resolve_program(std::vector<std::string>& argv) {
    std::string extension = boost::filesystem::path(argv[0]).extension().string();
    if (extension.empty())
        argv[0] += exe_suffix;
    else if (extension == ".ps1")
        argv.insert(argv.begin(), script_wrapper().begin(), script_wrapper().end());
    if (argv[0].find_first_of("/\\") == std::string::npos) {
        argv[0] = search_path(argv[0]);
        if (argv[0].empty())
            return {error_not_found, "search PATH"};
    }
    os_error error;
    argv[0] = absolute_path(argv[0], error);
    return error;
}

account_name split_account(const std::string& user) {
    auto slash = user.find('\\');
    if (slash == std::string::npos)
        return {{}, user};
    return {user.substr(0, slash), user.substr(slash + 1)};
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
