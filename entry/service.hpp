// The service path: the daemon run under the service manager, on the service
// thread, while stop controls arrive on the first one.
#pragma once

#include <cstddef>
#include <mutex>

#include <boost/asio/steady_timer.hpp>

#include "platform/platform.hpp"

namespace torvad {

class daemon;

class service_run {
  public:
    // The daemon must outlive the dispatcher's run.
    explicit service_run(daemon& supervisor);

    // Reports start, runs the loop until a stop control or the last persistent
    // child's end, stops the children and gives them a second run to end in.
    void main();
    // The stop and shutdown controls: only make the first run of the loop return.
    void control_stop();

  private:
    void report(platform::service_state state, std::size_t children);
    // Start pending goes on, with a new checkpoint each second, until ready.
    void show_progress();

    daemon& daemon_;
    // A stop control ends the first run of the loop only: the second run is
    // the children's orderly end, and a repeated stop must not cut it short.
    std::mutex first_run_guard_;
    bool first_run_over_ = false;
    boost::asio::steady_timer progress_;
};

} // namespace torvad
