#pragma once

namespace test {

/// Whether this process runs in a private root that `ternha-sandbox` made.
bool insideSandbox();

/// Ends the process with a message and exit code 99 when it is not inside the sandbox. Everything here that
/// touches files, programs or namespaces calls it first, so that a test can never reach the machine itself.
void requireSandbox();

}  // namespace test
