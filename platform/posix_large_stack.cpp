// Deep recursion on a stack of its own: a thread whose stack is only reserved,
// its pages touched as deep as the work goes.
#include "platform/platform.hpp"

#include <csignal>
#include <exception>
#include <pthread.h>

namespace torvad::platform {

namespace {

struct task {
    const std::function<void()>& work;
    std::exception_ptr failure;
};

void* run_task(void* argument) {
    auto* job = static_cast<task*>(argument);
    try {
        job->work();
    } catch (...) {
        job->failure = std::current_exception();
    }
    return nullptr;
}

} // namespace

bool run_on_large_stack(std::size_t stack_bytes, const std::function<void()>& work) {
    pthread_attr_t attributes;
    if (pthread_attr_init(&attributes) != 0)
        return false;
    task job{work, nullptr};
    // The thread starts with every signal blocked, so signals stay with the
    // threads that expect them.
    sigset_t all, kept;
    sigfillset(&all);
    pthread_sigmask(SIG_SETMASK, &all, &kept);
    pthread_t thread;
    bool started = pthread_attr_setstacksize(&attributes, stack_bytes) == 0 &&
                   pthread_create(&thread, &attributes, run_task, &job) == 0;
    pthread_sigmask(SIG_SETMASK, &kept, nullptr);
    pthread_attr_destroy(&attributes);
    if (!started)
        return false;
    pthread_join(thread, nullptr);
    if (job.failure)
        std::rethrow_exception(job.failure);
    return true;
}

} // namespace torvad::platform
