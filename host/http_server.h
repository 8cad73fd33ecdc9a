// `tcapi serve`: the module's methods over HTTP.
#ifndef TCAPI_HTTP_SERVER_H
#define TCAPI_HTTP_SERVER_H

#include <string>

#include "module_host.h"

namespace tcapi {

// Largest request body accepted, in bytes.
constexpr size_t kMaxRequestBody = 1 << 20;

struct ListenAddress {
  std::string host;
  int port = 0;  // 0: any free port
};

// "HOST:PORT" or "[IPv6]:PORT"; false with a reason on error.
bool ParseListen(const std::string& text, ListenAddress* address, std::string* error);

// Serves until SIGINT or SIGTERM. Prints where it listens on standard output.
// Returns the process exit status: 0 after a signal, 2 when it cannot listen.
int Serve(const Module& module, const ListenAddress& address, const std::string& rootShown);

}  // namespace tcapi

#endif
