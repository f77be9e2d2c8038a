#pragma once

#include <vector>

#include "options.h"

namespace sandbox {

/// Marks a private root. Its lines name the machine's directories in it, so that a sandbox started inside one
/// offers them too.
inline constexpr const char* kMarker = "/.ternha-sandbox";

/// The process file system of the sandbox itself; /proc holds fixtures that lead here.
inline constexpr const char* kKernelProc = "/.kernel/proc";

/// The directories that the sandbox around this process offers; none on the machine itself.
std::vector<Bind> inheritedBinds();

/// Builds the private root and makes it the root of this process, which must be pid 1 of new mount and pid
/// namespaces. The old root is out of reach afterwards. Throws Refusal.
void enterPrivateRoot(std::vector<Bind> binds);

}  // namespace sandbox
