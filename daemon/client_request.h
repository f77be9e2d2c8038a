#pragma once

namespace ternhad {

// The first character of the action that the request asks for, as the library reads it; 0 when there is none.
// The request has come to `fd` and stays there to be served.
char actionOf(int fd);

// Reads the request. One that is left unread would reset the connection, and with it a reply.
void discardRequest(int fd);

// Replies why the request is refused. The reply is not JSON: a client that only looks for one takes it for a
// failure.
void refuse(int fd, const char* reason);

}  // namespace ternhad
