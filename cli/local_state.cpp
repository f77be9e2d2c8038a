#include "local_state.h"

#include <algorithm>
#include <array>
#include <cctype>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string_view>

namespace ternhactl {

namespace {

// The states that the library counts as connected.
bool isLinked(const std::string& state) {
    static constexpr std::array<std::string_view, 13> LINKED = {
        "WFReportParams", "Connected",  "StartingSyncS", "StartingSyncT", "WFBitMapS",
        "WFBitMapT",      "WFSyncUUID", "SyncSource",    "SyncTarget",    "PausedSyncS",
        "PausedSyncT",    "VerifyS",    "VerifyT"};
    return std::find(LINKED.begin(), LINKED.end(), state) != LINKED.end();
}

// Return the value of the word "KEY:VALUE", or the empty string.
std::string valueOf(const std::vector<std::string>& words, const std::string& key) {
    for (const std::string& word : words) {
        if (word.rfind(key + ':', 0) == 0) {
            return word.substr(key.size() + 1);
        }
    }
    return {};
}

// Parse a line such as " 0: cs:Connected ro:Primary/Secondary ds:UpToDate/UpToDate C r-----".
void readResource(const std::vector<std::string>& words, LocalState& state) {
    const std::string name = "DRBD " + words.front().substr(0, words.front().find(':'));
    const std::string link = valueOf(words, "cs");
    if (link.empty() || link == "Unconfigured") {
        return;
    }
    state.hasResources = true;
    const bool isConnected = isLinked(link);
    if (!isConnected) {
        state.unlinked.push_back(name + " not connected (" + link + ')');
    }
    const std::string replicas = valueOf(words, "ds");
    const std::size_t slash = replicas.find('/');
    if (slash == std::string::npos) {
        return;
    }
    if (const std::string own = replicas.substr(0, slash); own != "UpToDate") {
        state.replicaProblems.push_back(name + " replica " + own);
    }
    // Without a connection, the state of the peer's replica is unknown.
    if (const std::string peer = replicas.substr(slash + 1); isConnected && peer != "UpToDate") {
        state.peerReplicaProblems.push_back(name + " peer's replica " + peer);
    }
}

void readDrbd(LocalState& state) {
    std::ifstream file("/proc/drbd");
    state.hasDrbd = file.is_open();
    std::string line;
    while (std::getline(file, line)) {
        std::istringstream text(line);
        std::vector<std::string> words;
        for (std::string word; text >> word;) {
            words.push_back(word);
        }
        if (words.size() < 2) {
            continue;
        }
        if (words.front() == "version:") {
            if (words[1].rfind("8.", 0) != 0) {
                state.unsupportedDrbd = words[1];
            }
        } else if (std::isdigit(static_cast<unsigned char>(words.front().front())) != 0) {
            readResource(words, state);
        }
    }
}

std::string firstWord(const std::filesystem::path& path) {
    std::ifstream file(path);
    std::string word;
    file >> word;
    return word;
}

// Return the entries of a directory whose names begin with `prefix`, sorted.
std::vector<std::filesystem::path> entries(const char* directory, const std::string& prefix) {
    std::vector<std::filesystem::path> found;
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator(directory, error)) {
        if (entry.path().filename().string().rfind(prefix, 0) == 0) {
            found.push_back(entry.path());
        }
    }
    std::sort(found.begin(), found.end());
    return found;
}

void readArrays(LocalState& state) {
    for (const auto& array : entries("/sys/block", "md")) {
        state.hasArrays = true;
        const std::string name = array.filename();
        const std::string missing = firstWord(array / "md/degraded");
        if (!missing.empty() && missing != "0") {
            state.arrayProblems.push_back(name + " degraded");
        }
        const std::string action = firstWord(array / "md/sync_action");
        if (action == "recover") {
            state.arrayProblems.push_back(name + " recovering");
        } else if (action == "reshape") {
            state.arrayProblems.push_back(name + " reshaping");
        }
    }
}

}  // namespace

std::string LocalState::missingDrbd() const {
    if (!hasDrbd) {
        return "no /proc/drbd";
    }
    return hasResources ? "" : "no resource";
}

LocalState readLocalState() {
    LocalState state;
    readDrbd(state);
    readArrays(state);
    for (const auto& port : entries("/sys/class/ata_port", "ata")) {
        state.hasAtaPorts = true;
        state.isErrorHandlingKnown =
            state.isErrorHandlingKnown || std::filesystem::exists(port / "error_handling");
    }
    return state;
}

}  // namespace ternhactl
