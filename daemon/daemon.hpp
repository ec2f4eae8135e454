// The one supervisor: the owner of every process (through its set of
// children), its event loop, the execution patterns and the sink of all log
// lines. main owns it; it must outlive every process, which it guarantees by
// shutting down (closing every handle and running the loop dry) before any
// of its members goes.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <unordered_set>

#include <boost/asio/io_context.hpp>
#include <boost/asio/signal_set.hpp>

#include "ipc/patterns.hpp"
#include "platform/platform.hpp"
#include "process/owner.hpp"

namespace torvad {

class process;

// How this run was asked to behave, from the command line and the console.
struct settings {
    bool verbose = false;     // -v: log_verbose lines and the packet trace
    bool logging = false;     // -l: every line also goes to the event log
    bool background = false;  // the service path: stdout is not a terminal, or -b
    bool auto_restart = true; // cleared by -o; any stop clears it for good
    bool readiness = false;   // -r: ready only once every persistent child says so
};

class daemon final : public process_owner {
  public:
    explicit daemon(const settings& chosen);
    ~daemon();
    daemon(const daemon&) = delete;
    daemon& operator=(const daemon&) = delete;

    bool colour() const { return colour_; }
    void set_colour(bool colour);
    // Console lines logged while a hold lives wait, and go out in one write
    // when the last hold ends: a child's exit line and its restart line, say.
    class console_hold {
      public:
        explicit console_hold(daemon& owner) : owner_(owner) { ++owner_.console_holds_; }
        ~console_hold();
        console_hold(const console_hold&) = delete;
        console_hold& operator=(const console_hold&) = delete;

      private:
        daemon& owner_;
    };

    // Names the service, loads the patterns (none: everything is allowed for
    // the child's own account) and arms the stop-signal wait. Called once.
    void configure(const std::string& name, const char* patterns_path);
    // At a console a plain kill is a stop request too.
    void add_stop_signal(int signal_number);
    // Starts every child made so far and logs how that went.
    void start();
    // The stop of the supervised: log, terminate the children, no more restarts.
    void stop_children();
    // Runs the loop while a persistent child is left, or until stop_loop.
    void run();
    // After a stop control: stop_children, then run the loop again for their end.
    void stop_and_run_to_end();
    // Makes run() return; the one way the loop is stopped, from any thread.
    void stop_loop();
    // Closes everything still open and runs the loop until no handler is
    // left, so nothing outlives the daemon's members. Called once, at the end.
    void shut_down();
    bool any_persistent() const { return persistent_children_ != 0; }
    std::size_t persistent_count() const { return persistent_children_; }
    // Reaps, from now on, the orphaned descendants the kernel hands us, never
    // a child we supervise. Called before any thread is started. (daemon/orphans.cpp)
    void take_orphans();
    void set_program_name(std::string name) { facts_.program_name = std::move(name); }
    const std::string& service_name() const { return service_name_; }
    // With -r, report runs once, on the loop, when every persistent child
    // started has said it is ready; a restart doesn't withdraw that.
    bool awaits_readiness() const { return settings_.readiness; }
    void when_ready(std::function<void()> report) { on_ready_ = std::move(report); }

    // What a process needs of its owner.
    boost::asio::io_context& loop() override { return loop_; }
    void adopt(std::shared_ptr<process> child) override;
    void remove(const std::shared_ptr<process>& child) override;
    void child_ended(const process& child, std::uint32_t status) override;
    void child_ready(const process& child) override;
    const pattern_lists& patterns() const override { return patterns_; }
    const run_facts& facts() const override { return facts_; }
    void write_log(platform::event_type type, const char* text) override;

  private:
    void load_patterns(const char* path);
    void name_awaited_children();
    void arm_signal_wait();
    void on_signal(const boost::system::error_code& error, int signal_number);
    void persistent_children_changed();
    void wait_for_orphans();
    void reap_orphans();

    // The loop goes first among the members and so is destroyed last: every
    // object below holds handles registered with it.
    boost::asio::io_context loop_;
    settings settings_;
    run_facts facts_;
    bool colour_;
    int console_holds_ = 0;
    std::string held_lines_;
    std::string service_name_;
    std::unordered_set<std::shared_ptr<process>> children_;
    std::size_t persistent_children_ = 0; // kept with children_, so never counted
    boost::asio::signal_set signals_;
    platform::stream orphan_watch_;
    pattern_lists patterns_;
    bool children_report_posted_ = false;
    // The persistent children that said they are ready, until all of them have.
    std::unordered_set<const process*> ready_children_;
    bool product_ready_ = false;
    std::function<void()> on_ready_;
    // The daemon's life; a stop or the shutdown moves it:
    //   state      stop                              shut_down
    //   running    -> stopping                       -> shut_down
    //   stopping   names whom it waits for           -> shut_down
    //   shut_down  nothing                           nothing
    enum class life { running, stopping, shut_down };
    life life_ = life::running;
};

} // namespace torvad
