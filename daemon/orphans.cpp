// The orphans the kernel hands us, as a container's first process or as the
// subreaper of our own descendants: reaped as they end, so that none stays a
// zombie, while the status of every supervised child is left to its exit wait.
#include "daemon/daemon.hpp"

#include <boost/asio/post.hpp>

namespace torvad {

void daemon::take_orphans() {
    int fd = -1;
    platform::os_error error = platform::watch_orphans(fd);
    if (error) {
        log_verbose("%s", platform::describe(error).c_str());
        return;
    }
    boost::system::error_code failure;
    orphan_watch_.assign(fd, failure);
    if (failure) {
        platform::close_descriptor(fd);
        return;
    }
    wait_for_orphans();
}

void daemon::wait_for_orphans() {
    // The daemon outlives the loop's handlers; a closed watch ends the wait.
    orphan_watch_.async_wait(boost::asio::posix::stream_descriptor::wait_read,
                             [this](const boost::system::error_code& error) {
                                 if (error)
                                     return;
                                 // Behind what is ready already: a supervised
                                 // child's end, and its restart, need not
                                 // wait for a scan of the others.
                                 boost::asio::post(*this, [this] {
                                     reap_orphans();
                                     wait_for_orphans();
                                 });
                             });
}

void daemon::reap_orphans() {
    // A supervised child's end stands in front of the others; its exit wait,
    // queued already, takes its status, and this comes again behind it.
    if (!platform::reap_orphans(orphan_watch_.native_handle()))
        boost::asio::post(*this, [this] { reap_orphans(); });
}

} // namespace torvad
