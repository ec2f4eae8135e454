// Accounts on Linux: the other system's names mapped to local ones, and an
// account resolved with its groups before a launch.
#include "platform/platform.hpp"
#include "platform/posix_children.hpp"

#include <cerrno>
#include <grp.h>
#include <pwd.h>
#include <strings.h>
#include <unistd.h>

namespace torvad::platform {

namespace {

std::string local_account_name(const std::string& user, bool& this_machine) {
    auto [domain, name] = split_account(user);
    bool nt_authority = strcasecmp(domain.c_str(), "NT Authority") == 0;
    this_machine = domain.empty() || domain == "." || nt_authority;
    // The built-in service accounts of the other system map to local ones.
    if (nt_authority && (strcasecmp(name.c_str(), "LocalService") == 0 ||
                         strcasecmp(name.c_str(), "NetworkService") == 0))
        return "nobody";
    if ((nt_authority && strcasecmp(name.c_str(), "System") == 0) ||
        (domain.empty() && strcasecmp(name.c_str(), "LocalSystem") == 0))
        return "root";
    return name;
}

} // namespace

os_error resolve_account(const std::string& user, account& out) {
    bool this_machine = false;
    std::string name = local_account_name(user, this_machine);
    // Another machine's account is none of ours: looked up as it is written,
    // it is not found.
    if (!this_machine)
        name = user;
    std::vector<char> buffer(16384);
    passwd entry{};
    passwd* found = nullptr;
    int error = getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
    if (found == nullptr || !this_machine)
        return {error != 0 ? error : ENOENT, "getpwnam_r"};
    out.uid = entry.pw_uid;
    out.gid = entry.pw_gid;
    // Switching needs root; without it the child's setgroups says so.
    out.change = entry.pw_uid != geteuid() || entry.pw_gid != getegid();
    if (!out.change)
        return {};
    int count = 64;
    std::vector<gid_t> groups(count);
    while (getgrouplist(name.c_str(), entry.pw_gid, groups.data(), &count) == -1)
        groups.resize(count);
    out.groups.assign(groups.begin(), groups.begin() + count);
    return {};
}

} // namespace torvad::platform
