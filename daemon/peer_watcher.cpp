#include "peer_watcher.h"

#include <json/json.h>

#include <memory>
#include <optional>
#include <string>

#include "checker.h"
#include "passes.h"
#include "printable.h"

namespace ternhad {

using TERN::HA::Daemon::IsRemoteDiskErrHandling;
using TERN::HA::Daemon::IsRemoteMDResync;

namespace {

// Return the text of the peer's reply to a check, or nothing without one. The result of the check
// does not distinguish a missing socket or an interruption by the stop from a negative reply.
template <typename Check>
std::optional<std::string> replyTo() {
    class Request : public Check {
     public:
        std::optional<std::string> send() {
            std::string reply;
            return this->_sendToRemote(reply) ? std::optional(reply) : std::nullopt;
        }
    };
    return Request().send();
}

bool isJson(const std::string& text) try {
    const std::unique_ptr<Json::CharReader> reader(Json::CharReaderBuilder().newCharReader());
    Json::Value value;
    return reader->parse(text.data(), text.data() + text.size(), &value, nullptr);
} catch (const Json::Exception&) {
    return false;  // nested past the parser's limit
}

}  // namespace

void PeerWatcher::run() {
    Passes passes;
    auto next = Clock::now();
    do {
        // It may be another machine now.
        if (_health.peerAppeared().take()) {
            _isHostnameKnown = false;
        }
        passes.run([this] {
            if (_health.isPeerAlive()) {  // requests to a dead peer only time out
                requestDisks();
                requestResync();
                requestHostname();
            }
        });
        next = nextRound(next, _options.checkInterval);
    } while (_shutdown.sleepUntil(next, {&_health.peerAppeared()}));
}

void PeerWatcher::requestDisks() {
    const Json::Value unread("unread");
    Json::Value disks = unread;
    const bool isHandling = IsRemoteDiskErrHandling()(disks);
    const bool isRead = disks != unread;
    if (_shutdown.isRequested() || (!isRead && !isReportCut())) {
        return;
    }
    // Disk errors on unknown disks: those of the previous report may have recovered.
    _health.status().setErrHandlingDiskRemote(isRead ? disks : Json::Value(Json::arrayValue));
    _health.findings().setPeerDisksKnown(isRead);
    _health.set(Flag::peerDiskErrors, isHandling || !isRead);
}

// Return true if the report was truncated: it lists more disks than a datagram holds.
bool PeerWatcher::isReportCut() const {
    if (!_health.isPeerAlive()) {
        return false;
    }
    const auto report = replyTo<IsRemoteDiskErrHandling>();
    return report && !isJson(*report);
}

void PeerWatcher::requestResync() {
    const auto reply = replyTo<IsRemoteMDResync>();
    if (reply == "resync" || reply == "not_resync") {
        _health.set(Flag::peerResync, reply == "resync");
    } else if (!reply && !_shutdown.isRequested()) {
        // The check logs that there is no reply, unless there is one this time.
        if (IsRemoteMDResync()() && !_shutdown.isRequested()) {
            _health.set(Flag::peerResync, true);
        }
    }
}

void PeerWatcher::requestHostname() {
    if (_isHostnameKnown || _shutdown.isRequested()) {
        return;
    }
    std::string hostname;
    _isHostnameKnown = TERN::HA::Daemon::GetRemoteHostname()(hostname);
    if (_isHostnameKnown) {
        _health.findings().setPeerName(printable(hostname));
        TERNHAD_LOG(_events, "Remote hostname is " + printable(hostname));
    }
}

}  // namespace ternhad
