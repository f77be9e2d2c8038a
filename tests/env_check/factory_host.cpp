// A host daemon that compares the registry with its own factories. Built in several ways, which
// differ in how the address of a template instance is resolved.

#include <cstdio>

#include "checker.h"

namespace {

using namespace TERN::HA::Daemon;

template <class Check>
bool isRegistered() {
    const std::string name = Check().getType();
    if (CheckerFactory::opMap->at(name) == &createEnvCheckT<Check>) {
        return true;
    }
    std::printf("%s: the registry holds another address\n", name.c_str());
    return false;
}

}  // namespace

int main() {
    const bool results[] = {isRegistered<IsRemoteAlive>(), isRegistered<IsRemoteMDResync>(),
                            isRegistered<IsRemoteDiskErrHandling>(), isRegistered<RebootRemote>(),
                            isRegistered<GetRemoteHostname>()};
    for (const bool result : results) {
        if (!result) {
            return 1;
        }
    }
    return 0;
}
