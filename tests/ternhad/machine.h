#pragma once

#include <filesystem>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "support/files.h"
#include "support/node.h"
#include "support/programs.h"
#include "ternhad/daemon.h"

namespace test {

// A machine of the cluster and its daemon.
struct Machine {
    Machine(const std::string& name, std::string ownAddress, std::string peersAddress)
        : node(name), address(std::move(ownAddress)), peer(std::move(peersAddress)) {
        write("/tmp/.ha.hostname.original", name + "\n");
        write("/proc/drbd", " 0: cs:Connected ro:Primary/Secondary\n");
        write("/sys/block/md0/md/sync_action", "idle\n");
        write("/sys/class/ata_port/ata3/error_handling", "0\n");
        const std::string device = "/sys/devices/pci0/ata3/host2/target2:0:0/2:0:0:0/block/sda";
        makeDirectories(node.path(device));
        std::filesystem::create_symlink(".." + device.substr(4), node.path("/sys/block/sda"));
    }

    void write(const std::string& path, const std::string& text) { writeFile(node.path(path), text); }

    void start(const std::vector<std::string>& more = {}) {
        daemon.emplace(node.start(daemonArguments(address, peer, "eth1", more)));
    }

    std::string log() { return wholeLog(node.path("")); }
    std::string record() { return wholeLog(node.path(""), "ha.daemon.record"); }
    Json::Value status() { return statusAt(node.path(CONTROL_SOCKET)); }

    bool sees(const char* flag, bool value) {
        const Json::Value known = status();
        return known.isObject() && known[flag].asBool() == value;
    }

    Node node;
    std::string address;
    std::string peer;
    std::optional<Process> daemon;
};

}  // namespace test
