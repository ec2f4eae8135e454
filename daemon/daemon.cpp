#include "daemon/daemon.hpp"

#include <csignal>

#include "ipc/patterns.hpp"
#include "process/process.hpp"

namespace torvad {

bool verbose = false;
bool logging = false;
bool background = false;
bool auto_restart = true;
const char* const daemon_version = "1.1.21.0";

daemon::daemon() : colour(platform::stdout_is_terminal()), signals(*this, SIGINT) {}

daemon::~daemon() {
    // Children go first, while the loop's services still exist for the
    // descriptors they close; the base then drops whatever handlers remain.
    children.clear();
}

void daemon::configure(const std::string& name, const char* patterns_path) {
    service_name = name;
    if (patterns_path == nullptr)
        allow_all = true;
    else
        load_patterns(*this, patterns_path);
    arm_signal_wait();
}

void daemon::arm_signal_wait() {
    signals.async_wait([this](const boost::system::error_code& error, int signal_number) {
        on_signal(error, signal_number);
    });
}

void daemon::start() {
    // Starting a child that fails takes it out of the live set, so walk a copy.
    auto starting = children;
    bool all_started = true;
    for (const auto& child : starting)
        all_started = child->start() && all_started;
    if (all_started)
        log_info("successfully started torvad version %s", daemon_version);
    else if (any_persistent())
        log_warning("started torvad version %s", daemon_version);
    else
        log_error("failed to start torvad version %s", daemon_version);
}

void daemon::terminate_children() {
    log_info("stopping torvad version %s...", daemon_version);
    // terminate never changes the set (an exit is seen later, on the loop),
    // but a copy keeps that a local fact rather than a promise of process.
    auto stopping = children;
    for (const auto& child : stopping)
        if (child->parent.expired() || child->persistent)
            child->terminate();
    auto_restart = false;
}

void daemon::stop() {
    terminate_children();
}

void daemon::on_signal(const boost::system::error_code& error, int /*signal_number*/) {
    if (error)
        return;
    terminate_children();
    arm_signal_wait();
    if (!any_persistent())
        io_context::stop();
}

bool daemon::any_persistent() const {
    for (const auto& child : children)
        if (child->persistent)
            return true;
    return false;
}

void daemon::run() {
    if (!any_persistent())
        return;
    boost::system::error_code error;
    io_context::run(error);
    if (error)
        throw boost::system::system_error(error);
}

void daemon::remove(std::shared_ptr<process> child) {
    for (const auto& member : children)
        if (member->parent.lock() == child)
            member->close_pipes();
    children.erase(child);
    if (!any_persistent())
        io_context::stop();
}

daemon the_daemon;

} // namespace torvad
