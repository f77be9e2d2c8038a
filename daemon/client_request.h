#pragma once

namespace ternhad {

// Return the first character of the requested action, parsed as the library does; 0 if there is
// none. Peeks at the request on `fd` and leaves it to be served.
char actionOf(int fd);

// Read and discard the request. Closing a connection with unread data would reset it, and the reply
// would be lost.
void discardRequest(int fd);

// Send the reason for refusing a request. It is not JSON, so that clients that only parse the reply
// report a failure.
void refuse(int fd, const char* reason);

}  // namespace ternhad
