// The daemon's life: configuration, the start of its children, the signal
// that stops them, the end of the run when no persistent child is left, and
// the shutdown after it.
#include "daemon/daemon.hpp"

#include <csignal>
#include <exception>

#include <boost/asio/post.hpp>

#include "daemon/patterns_file.hpp"
#include "process/process.hpp"

namespace torvad {

daemon::daemon(const settings& chosen)
    : settings_(chosen), colour_(platform::console_takes_colour()), signals_(loop_, SIGINT),
      orphan_watch_(loop_) {
    facts_.verbose = settings_.verbose;
    facts_.background = settings_.background;
    set_colour(colour_);
}

daemon::~daemon() {
    shut_down();
}

void daemon::set_colour(bool colour) {
    colour_ = colour;
    // A trace line in the event log stays plain.
    facts_.trace_colour = colour && !settings_.logging;
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
}

void daemon::add_stop_signal(int signal_number) {
    boost::system::error_code error;
    signals_.add(signal_number, error);
    if (error)
        log_verbose("sigaction: %s", error.message().c_str());
}

void daemon::arm_signal_wait() {
    // The daemon outlives every handler of its loop (see shut_down).
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
        log_info("successfully started torvad version %s", torvad_version);
    else if (any_persistent())
        log_warning("started torvad version %s", torvad_version);
    else
        log_error("failed to start torvad version %s", torvad_version);
}

void daemon::stop_children() {
    if (life_ == life::shut_down)
        return;
    log_info("stopping torvad version %s...", torvad_version);
    // terminate never changes the set (an exit is seen later, on the loop),
    // but a copy keeps that a local fact rather than a promise of process.
    auto stopping = children_;
    for (const auto& child : stopping)
        if (child->place.parent.expired() || child->what.persistent)
            child->terminate();
    settings_.auto_restart = false;
    // Nothing escalates after sigterm, so a stop asked for again can only
    // say whom it is waiting for.
    if (life_ == life::stopping)
        name_awaited_children();
    life_ = life::stopping;
}

void daemon::name_awaited_children() {
    std::string awaited;
    for (const auto& child : children_)
        if (child->what.persistent)
            awaited += (awaited.empty() ? "" : ", ") + child->description();
    if (!awaited.empty())
        log_warning("still waiting for %s to end after sigterm.", awaited.c_str());
}

void daemon::on_signal(const boost::system::error_code& error, int /*signal_number*/) {
    if (error)
        return;
    stop_children();
    arm_signal_wait();
    if (!any_persistent())
        stop_loop();
}

// One report per turn of the loop at most: a restart adds the successor and
// removes its predecessor in one turn, which changes nothing worth telling.
void daemon::persistent_children_changed() {
    if (children_report_posted_)
        return;
    children_report_posted_ = true;
    boost::asio::post(loop_, [this] {
        children_report_posted_ = false;
        if (platform::os_error error = platform::report_service_children(persistent_count()))
            log_verbose("%s", platform::describe(error).c_str());
    });
}

void daemon::run() {
    // Handlers report failures by result, not by exception; what can still
    // come out of one is an allocation that failed. The loop logs it and goes
    // on, so that one child's bad moment doesn't end the others' supervision.
    while (any_persistent()) {
        try {
            loop_.run();
            return;
        } catch (const std::exception& failure) {
            log_error("internal error: %s", failure.what());
        }
    }
}

void daemon::stop_and_run_to_end() {
    stop_children();
    // A stop control stopped the loop, maybe before the first run began;
    // only now, with the children asked to end, may it run again.
    loop_.restart();
    run();
}

void daemon::stop_loop() {
    loop_.stop();
}

void daemon::shut_down() {
    if (life_ == life::shut_down)
        return;
    life_ = life::shut_down;
    boost::system::error_code ignored;
    signals_.cancel(ignored);
    orphan_watch_.close(ignored);
    for (const auto& child : children_)
        child->close_all();
    // Every pending handler now completes as aborted and lets go of its
    // process; nothing is sent or logged from here on.
    loop_.restart();
    try {
        loop_.run();
    } catch (const std::exception&) {
    }
    children_.clear();
}

void daemon::adopt(std::shared_ptr<process> child) {
    if (child->what.persistent) {
        ++persistent_children_;
        persistent_children_changed();
    }
    children_.insert(std::move(child));
}

void daemon::remove(const std::shared_ptr<process>& child) {
    ready_children_.erase(child.get());
    if (children_.erase(child) != 0 && child->what.persistent) {
        --persistent_children_;
        persistent_children_changed();
    }
    if (!any_persistent())
        stop_loop();
}

void daemon::child_ended(const process& child, std::uint32_t status) {
    bool again = status != 0 && settings_.auto_restart && child.what.persistent;
    {
        // Both lines in one console write, and both ahead of the launch.
        console_hold lines(*this);
        if (status == 0)
            log_info("'%s' exited with 0x%x.", child.name.c_str(), status);
        else
            log_warning("'%s' exited with 0x%x.", child.name.c_str(), status);
        if (again)
            log_info("starting '%s' again.", child.name.c_str());
    }
    // The successor is in the set before its predecessor leaves, so the run
    // never looks empty across a restart.
    if (again)
        process::create(*this, child.what, child.place)->start();
}

// A successor starts unready, but the product was ready once and stays so:
// those who waited for it have acted on it already.
void daemon::child_ready(const process& child) {
    if (!settings_.readiness || !child.what.persistent || product_ready_)
        return;
    ready_children_.insert(&child);
    if (ready_children_.size() < persistent_children_)
        return;
    product_ready_ = true;
    ready_children_.clear();
    log_info("the product is ready.");
    if (on_ready_)
        on_ready_();
}

} // namespace torvad
