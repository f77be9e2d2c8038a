#pragma once

#include <string>
#include <vector>

/// Files of the sandbox. Paths are absolute; failures throw std::system_error.
namespace test {

/// Replaces the content of `path`; missing parent directories are made.
void writeFile(const std::string& path, const std::string& text);

/// Adds to the end of `path`; the file and its parent directories are made when missing.
void appendFile(const std::string& path, const std::string& text);

/// The whole content, byte for byte.
std::string readFile(const std::string& path);

/// Whether there is a file of any kind; a dangling link counts.
bool exists(const std::string& path);

/// Makes the directory and its missing parents.
void makeDirectories(const std::string& path);

/// Removes a file, or a directory with all in it. Nothing happens when there is none.
void removeTree(const std::string& path);

/// The lines of `text` without their line ends. A last line without an end counts too.
std::vector<std::string> lines(const std::string& text);

}  // namespace test
