// The checks of an execute request, in the order the peer is told about them:
// the optional user and path items, the executable, then the permission.
#include "ipc/execute.hpp"

#include "ipc/strings.hpp"

namespace torvad {

namespace {

// Takes the first item into value when a further item stands behind it.
bool take_leading_item(std::vector<std::string>& items, std::string& value) {
    if (items.size() < 2)
        return false;
    value = std::move(items.front());
    items.erase(items.begin());
    return true;
}

std::int32_t requested_stdio(std::uint32_t flags) {
    if (flags & execute_stdio_pipes)
        return stdio_pipes;
    return flags & execute_stdio_none ? stdio_none : stdio_inherit;
}

execute_decision refused(const char* text, std::uint32_t status, bool undecided = false) {
    execute_decision decision;
    decision.refusal = text;
    decision.status = status;
    decision.undecided = undecided;
    return decision;
}

} // namespace

execute_decision decide_execute(std::uint32_t flags, const char* payload, std::size_t size,
                                const std::string& requester_user,
                                const std::string& requester_path, const pattern_lists& patterns,
                                match_clock clock, std::vector<tried_line>* tried) {
    auto items = split_strings(payload, size, '\0');
    std::string user = requester_user, path = requester_path;
    if ((flags & execute_user) && !take_leading_item(items, user))
        return refused("user not specified", status_malformed);
    if ((flags & execute_path) && !take_leading_item(items, path))
        return refused("path not specified", status_malformed);
    if (items.front().empty())
        return refused("executable not specified", status_malformed);
    permission granted = decide_permission(patterns, requester_user, user, items, clock, tried);
    if (granted.refusal != nullptr)
        return refused(granted.refusal, status_not_permitted, granted.undecided);
    execute_decision decision;
    decision.request = {std::move(items), std::move(user), std::move(path),
                        (flags & execute_persistent) != 0, requested_stdio(flags)};
    return decision;
}

} // namespace torvad
