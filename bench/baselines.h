#pragma once

#include <cstddef>
#include <string>
#include <vector>

// Baselines: minimal code with the same system calls as an operation of the library. Failures end
// the process, so that a baseline never does less.
namespace baseline {

// Read the clock and append `line` to the file at `path`.
void appendLine(const char* path, const std::string& line);

// Append the lines of one file to another, each with one write, and truncate it.
void moveLines(const char* from, const char* to);

// Send a request to 127.0.0.1:`port` and wait for the reply.
void askPeer(int port, const char* question);

// A datagram socket bound to 127.0.0.1:`port`.
int peerSocket(int port);

// Receive a request on the socket and reply.
void answerPeer(int socket, const char* answer);

// A stream socket that listens at `path`.
int controlSocket(const char* path);

// Send `request` over a connection to `path` and reads the reply.
void askControl(const char* path, const std::string& request);

// Accept a connection, read its request and send `reply`.
void answerControl(int socket, const std::string& reply);

// Read the file and search for the thirteen states.
bool containsAny(const char* path, const std::vector<std::string>& words);

// Read `member` in each directory that matches `pattern`.
void readEach(const char* pattern, const char* member);

// Start /bin/true with a pipe and wait for it.
void runTrue();

// Read the whole file.
std::string readAll(const char* path);

}  // namespace baseline
