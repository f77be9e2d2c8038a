#pragma once

#include <cstddef>
#include <string>
#include <vector>

// The shortest plain programs with the same effect on the kernel as the operation they stand beside. Failures
// end the process: a baseline that does less is none.
namespace baseline {

// Asks the clock, appends `line` to the file at `path`.
void appendLine(const char* path, const std::string& line);

// Appends the lines of one file to another, each with one write, and empties it.
void moveLines(const char* from, const char* to);

// Asks 127.0.0.1:`port` one question, and waits for the answer.
void askPeer(int port, const char* question);

// A datagram socket bound to 127.0.0.1:`port`.
int peerSocket(int port);

// Receives one question on the socket and answers it.
void answerPeer(int socket, const char* answer);

// A stream socket that listens at `path`.
int controlSocket(const char* path);

// Sends `request` over a connection to `path` and reads the reply.
void askControl(const char* path, const std::string& request);

// Accepts one connection, reads its request and sends `reply`.
void answerControl(int socket, const std::string& reply);

// Reads the file and looks for the thirteen words.
bool containsAny(const char* path, const std::vector<std::string>& words);

// Reads `member` in each directory that matches `pattern`.
void readEach(const char* pattern, const char* member);

// Starts /bin/true, with its output in a pipe, and waits for its end.
void runTrue();

// Reads the whole file.
std::string readAll(const char* path);

}  // namespace baseline
