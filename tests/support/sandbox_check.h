#pragma once

namespace test {

/// Path of script/sandbox inside each sandbox.
inline constexpr char SANDBOX[] = "/.machine/sandbox";

/// Exit with a message and code 99 unless the process runs in a sandbox of `script/sandbox`. Every
/// test program calls it first, so that none can reach the machine itself.
void requireSandbox();

}  // namespace test
