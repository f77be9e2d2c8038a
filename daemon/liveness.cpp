#include "liveness.h"

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <system_error>

#include "checker.h"

namespace ternhad {

using TERN::HA::Daemon::IsRemoteAlive;

namespace {

constexpr int QUESTIONS = 10;
constexpr auto QUESTION_STEP = std::chrono::milliseconds(300);

// The first answer to any of the questions.
class Answer {
 public:
    void set() {
        const std::lock_guard<std::mutex> lock(_mutex);
        _hasCome = true;
        _coming.notify_all();
    }

    bool waitFor(std::chrono::milliseconds limit) {
        std::unique_lock<std::mutex> lock(_mutex);
        return _coming.wait_for(lock, limit, [this] { return _hasCome; });
    }

 private:
    std::mutex _mutex;
    std::condition_variable _coming;
    bool _hasCome = false;
};

}  // namespace

bool Liveness::ask(bool wasAlive, const std::function<bool()>& isStopping) {
    if (!wasAlive) {
        return IsRemoteAlive()();
    }
    // Counted in questions, not in time: a process that was stopped for a while goes on asking.
    const auto answer = std::make_shared<Answer>();
    for (int i = 0; i < QUESTIONS && !isStopping(); ++i) {
        const auto isOver = [](const std::future<void>& question) {
            return question.wait_for(std::chrono::seconds(0)) == std::future_status::ready;
        };
        _questions.erase(std::remove_if(_questions.begin(), _questions.end(), isOver), _questions.end());
        try {
            _questions.push_back(std::async(std::launch::async, [answer] {
                if (IsRemoteAlive()()) {
                    answer->set();
                }
            }));
        } catch (const std::system_error&) {
            // No thread to be had: as good as a lost question, and there are others.
        }
        if (answer->waitFor(QUESTION_STEP)) {
            return true;
        }
    }
    return false;
}

}  // namespace ternhad
