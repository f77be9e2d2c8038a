#pragma once

namespace test {

/// script/sandbox, as each of its sandboxes has it.
inline constexpr char SANDBOX[] = "/.machine/sandbox";

/// Ends the process with a message and exit code 99 when it does not run in a private root that
/// `script/sandbox` made. Every program of the tests calls it first, so that none can reach the machine
/// itself.
void requireSandbox();

}  // namespace test
