// The orphans the kernel hands us, as a container's first process or as the
// subreaper of our own descendants: reaped as they end, so that none stays a
// zombie, while the status of every supervised child is left to its exit wait.
#include "daemon/daemon.hpp"

#include <boost/asio/post.hpp>

namespace torvad {

void daemon::take_orphans() {
    platform::os_error error = platform::watch_orphans(orphan_watch_);
    if (error)
        log_verbose("%s", platform::describe(error).c_str());
    // Where nothing is ever handed over, nothing is watched.
    if (orphan_watch_.is_open())
        wait_for_orphans();
}

void daemon::wait_for_orphans() {
    // The daemon outlives the loop's handlers; a closed watch ends the wait.
    platform::await_orphans(orphan_watch_, [this](const boost::system::error_code& error) {
        if (error)
            return;
        // Behind what is ready already: a supervised child's end, and its
        // restart, need not wait for a scan of the others.
        boost::asio::post(loop_, [this] {
            reap_orphans();
            wait_for_orphans();
        });
    });
}

void daemon::reap_orphans() {
    // A supervised child's end stands in front of the others; its exit wait,
    // queued already, takes its status, and this comes again behind it.
    if (!platform::reap_orphans(orphan_watch_))
        boost::asio::post(loop_, [this] { reap_orphans(); });
}

} // namespace torvad
