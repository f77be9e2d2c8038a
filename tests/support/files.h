#pragma once

#include <string>
#include <vector>

/// Files of the sandbox. Paths are absolute; failures throw std::system_error.
namespace test {

/// Replace the content of `path`; create missing parent directories.
void writeFile(const std::string& path, const std::string& text);

/// Append to `path`; create the file and its parent directories if missing.
void appendFile(const std::string& path, const std::string& text);

/// Return the whole content.
std::string readFile(const std::string& path);

/// Return whether a file of any kind exists; a dangling link counts.
bool exists(const std::string& path);

/// Create the directory and its missing parents.
void makeDirectories(const std::string& path);

/// Remove a file or a directory tree, if it exists.
void removeTree(const std::string& path);

/// Split `text` into lines without newlines. An unterminated last line counts.
std::vector<std::string> lines(const std::string& text);

}  // namespace test
