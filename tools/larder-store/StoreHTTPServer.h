#pragma once

#include <httplib.h>
#include <sys/socket.h>

namespace larder {

// httplib's server with a listen backlog fit for bursts of connections:
// the library listens with a backlog of 5, and a connection beyond that
// waits a whole SYN retransmission (a second) before it is accepted.
class StoreHTTPServer : public httplib::Server {
 public:
  // Call after binding; listening again on the bound socket only changes
  // its backlog.
  bool widenBacklog() {
    const socket_t socket = svr_sock_;
    return socket != INVALID_SOCKET && ::listen(socket, SOMAXCONN) == 0;
  }
};

}  // namespace larder
