// An execute request from a hostile child against patterns from a careless
// operator: the input is a patterns file, a NUL NUL separator, then the flags
// byte and the request's payload. Whatever it is, the decision comes back,
// and it never permits more than the patterns say.
#include <cstdint>
#include <string>
#include <string_view>

#include "ipc/execute.hpp"
#include "ipc/strings.hpp"
#include "platform/platform.hpp"

using namespace torvad;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    std::string_view input(reinterpret_cast<const char*>(data), size);
    std::size_t split = input.find(std::string_view("\0\0", 2));
    if (split == std::string_view::npos || split + 3 > input.size())
        return 0;
    std::vector<skipped_line> skipped;
    pattern_lists patterns = parse_patterns(input.substr(0, split), skipped);
    std::uint32_t flags = static_cast<unsigned char>(input[split + 2]);
    std::string_view payload = input.substr(split + 3);
    execute_decision decision = decide_execute(flags, payload.data(), payload.size(), "svc", "/srv",
                                               patterns, platform::thread_cpu_nanoseconds);
    if (decision.refusal != nullptr)
        return 0;
    const execute_request& request = decision.request;
    // Accepted: there is a program, and a closed file with no line permits nothing.
    if (request.command.empty() || request.command[0].empty())
        __builtin_trap();
    if (patterns.exec.empty() && patterns.all.empty())
        __builtin_trap();
    if (request.user != "svc" && patterns.all.empty())
        __builtin_trap();
    return 0;
}
