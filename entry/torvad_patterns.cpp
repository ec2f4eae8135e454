// torvad-patterns: checks a patterns file before it ships, and explains the
// decision torvad makes on one request, with torvad's own code.
#include <cstdio>

#include "entry/patterns_tool.hpp"
#include "platform/platform.hpp"

using namespace torvad;

int main(int argc, char** argv) {
    patterns_tool::command_line request;
    if (!patterns_tool::parse_command_line({argv + 1, argv + argc}, request)) {
        std::fputs(patterns_tool::usage, stderr);
        return 64;
    }
    patterns_file file = load_patterns_file(request.path);
    patterns_tool::report result =
        request.check ? patterns_tool::check(request.path, file)
                      : patterns_tool::explain(request, file, platform::thread_cpu_nanoseconds);
    std::fwrite(result.out.data(), 1, result.out.size(), stdout);
    std::fwrite(result.err.data(), 1, result.err.size(), stderr);
    return result.status;
}
