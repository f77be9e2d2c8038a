#include "threads.h"

#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <csignal>
#include <filesystem>
#include <fstream>
#include <string>
#include <utility>

#include "passes.h"

namespace ternhad {

namespace {

constexpr auto JOIN_STEP = std::chrono::milliseconds(20);

void ignoreSignal(int) {}

// Interrupt the blocking calls of the other threads and terminate the programs that they wait for:
// ping alone may take 10 seconds. Except the calling thread's own child.
void interruptThreads() {
    std::error_code error;
    for (const auto& task : std::filesystem::directory_iterator("/proc/self/task", error)) {
        const pid_t thread = std::stoi(task.path().filename());
        if (thread == gettid()) {
            continue;
        }
        tgkill(getpid(), thread, SIGUSR1);
        std::ifstream children(task.path() / "children");
        pid_t child = 0;
        while (children >> child) {
            kill(child, SIGTERM);
        }
    }
}

}  // namespace

Threads::Threads() {
    struct sigaction action = {};
    action.sa_handler = ignoreSignal;
    sigaction(SIGUSR1, &action, nullptr);
}

void Threads::start(const char* name, std::function<void()> body) {
    std::promise<void> promise;
    std::future<void> end = promise.get_future();
    // An uncaught exception ends the process: a daemon that lacks a thread would only seem to work.
    std::thread thread([name, body = std::move(body), done = std::move(promise)]() mutable noexcept {
        pthread_setname_np(pthread_self(), name);
        body();
        done.set_value();
    });
    _workers.push_back({std::move(thread), std::move(end)});
}

bool Threads::join(Clock::time_point deadline) {
    // A signal that arrives just before the call blocks is lost: repeat it until the thread has
    // ended.
    for (Worker& worker : _workers) {
        while (worker.end.wait_for(JOIN_STEP) != std::future_status::ready) {
            if (Clock::now() > deadline) {
                return false;
            }
            attempt(interruptThreads);
        }
        worker.thread.join();
    }
    _workers.clear();
    return true;
}

bool isolateDescriptors() noexcept {
#ifdef __SANITIZE_THREAD__
    return false;  // the thread sanitizer assumes a single descriptor table
#else
    Event::seal();
    return unshare(CLONE_FILES) == 0;
#endif
}

void raisePriority(Priority priority) noexcept {
    sched_param parameters = {};
    parameters.sched_priority = sched_get_priority_max(SCHED_RR) - static_cast<int>(priority);
    pthread_setschedparam(pthread_self(), SCHED_RR, &parameters);
}

}  // namespace ternhad
