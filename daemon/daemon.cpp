// The daemon's life: configuration, the start of its children, the signal
// that stops them, and the end of the run when no persistent child is left.
#include "daemon/daemon.hpp"

#include <csignal>
#include <exception>

#include <boost/asio/post.hpp>

#include "daemon/patterns_file.hpp"
#include "process/process.hpp"

namespace torvad {

bool verbose = false;
bool logging = false;
bool background = false;
bool auto_restart = true;
const char* const daemon_version = "1.1.21.0";

daemon::daemon()
    : colour_(platform::console_takes_colour()), signals_(*this, SIGINT),
      orphan_watch_(get_executor()) {}

daemon::~daemon() {
    // Children go first, while the loop's services still exist for the
    // descriptors they close; the base then drops whatever handlers remain.
    children_.clear();
}

void daemon::configure(const std::string& name, const char* patterns_path) {
    service_name_ = name;
    if (patterns_path != nullptr)
        load_patterns(patterns_path);
    arm_signal_wait();
}

void daemon::load_patterns(const char* path) {
    patterns_file file = load_patterns_file(path);
    patterns_ = std::move(file.lists);
    if (!file.open_failure.empty()) {
        log_error("%s", file.open_failure.c_str());
        log_verbose("%s", file.open_failure_reason.c_str());
    }
    for (const auto& skipped : file.skipped)
        log_error("%s", describe_skipped(skipped, path).c_str());
    if (!file.stack_failure.empty())
        log_error("%s", file.stack_failure.c_str());
}

void daemon::add_stop_signal(int signal_number) {
    boost::system::error_code error;
    signals_.add(signal_number, error);
    if (error)
        log_verbose("sigaction: %s", error.message().c_str());
}

void daemon::arm_signal_wait() {
    signals_.async_wait([this](const boost::system::error_code& error, int signal_number) {
        on_signal(error, signal_number);
    });
}

void daemon::start() {
    // Starting a child that fails takes it out of the live set, so walk a copy.
    auto starting = children_;
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
    auto stopping = children_;
    for (const auto& child : stopping)
        if (child->parent.expired() || child->persistent)
            child->terminate();
    auto_restart = false;
    // Nothing escalates after sigterm, so a stop asked for again can only
    // say whom it is waiting for.
    if (stop_requested_)
        name_awaited_children();
    stop_requested_ = true;
}

void daemon::name_awaited_children() {
    std::string awaited;
    for (const auto& child : children_)
        if (child->persistent)
            awaited += (awaited.empty() ? "" : ", ") + child->description();
    if (!awaited.empty())
        log_warning("still waiting for %s to end after sigterm.", awaited.c_str());
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
    return persistent_children_ != 0;
}

std::size_t daemon::persistent_count() const {
    return persistent_children_;
}

// One report per turn of the loop at most: a restart adds the successor and
// removes its predecessor in one turn, which changes nothing worth telling.
void daemon::persistent_children_changed() {
    if (children_report_posted_)
        return;
    children_report_posted_ = true;
    boost::asio::post(*this, [this] {
        children_report_posted_ = false;
        platform::report_service_children(persistent_count());
    });
}

void daemon::run() {
    // Handlers report failures by result, not by exception; what can still
    // come out of one is an allocation that failed. The loop logs it and goes
    // on, so that one child's bad moment doesn't end the others' supervision.
    while (any_persistent()) {
        try {
            io_context::run();
            return;
        } catch (const std::exception& failure) {
            log_error("internal error: %s", failure.what());
        }
    }
}

void daemon::adopt(std::shared_ptr<process> child) {
    if (child->persistent) {
        ++persistent_children_;
        persistent_children_changed();
    }
    children_.insert(std::move(child));
}

void daemon::remove(const std::shared_ptr<process>& child) {
    // Each process knows its channels: an end costs the same however many
    // children there are.
    child->close_channel_pipes();
    if (children_.erase(child) != 0 && child->persistent) {
        --persistent_children_;
        persistent_children_changed();
    }
    if (!any_persistent())
        io_context::stop();
}

// The start state is made before the daemon's own descriptors exist, so that
// none of them can take the number of a standard stream a parent left closed.
static const bool own_process_prepared = (platform::prepare_own_process(), true);

daemon the_daemon;

} // namespace torvad
