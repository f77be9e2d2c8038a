#pragma once

#include <functional>
#include <future>
#include <vector>

namespace ternhad {

// Whether the peer is alive, told from more than one question: a lost datagram must not look like a dead
// peer. For one thread.
class Liveness {
 public:
    // Asks the peer for life. A peer that was alive is asked up to ten times, 300 ms apart, each time while
    // the earlier questions may still be answered; it counts as dead when no answer has come after 3 seconds.
    // A peer that was dead is asked once and has 3 seconds. Returns earlier, with a result that means
    // nothing, when `isStopping` is true.
    bool ask(bool wasAlive, const std::function<bool()>& isStopping);

 private:
    std::vector<std::future<void>> _questions;  // some may still be waited for when another has been answered
};

}  // namespace ternhad
