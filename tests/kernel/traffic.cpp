#include "traffic.h"

#include <arpa/inet.h>
#include <errno.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstring>
#include <thread>
#include <vector>

namespace kerneltest {
namespace {

using Clock = std::chrono::steady_clock;

class Socket {
 public:
  explicit Socket(int fd = -1) : fd_(fd) {}
  ~Socket() { Reset(); }
  Socket(const Socket&) = delete;
  Socket& operator=(const Socket&) = delete;
  int get() const { return fd_; }
  void Reset(int fd = -1) {
    if (fd_ >= 0) close(fd_);
    fd_ = fd;
  }

 private:
  int fd_;
};

void SetTimeouts(int fd, int ms) {
  struct timeval tv = {ms / 1000, (ms % 1000) * 1000};
  setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof tv);
}

std::string Errno(const char* what) { return std::string(what) + ": " + std::strerror(errno); }

double Since(Clock::time_point t0) {
  return std::chrono::duration<double>(Clock::now() - t0).count();
}

}  // namespace

double TcpRateKBps(const Topology& t, uint16_t port, const TcpLimits& limits, std::string* error) {
  sockaddr_in addr{};
  addr.sin_family = AF_INET;
  addr.sin_port = htons(port);
  inet_pton(AF_INET, Addr::kL4, &addr.sin_addr);

  Socket listener, client;
  {
    InNamespace in(t.L());
    if (!in.ok()) return *error = "cannot enter the LAN namespace", -1;
    listener.Reset(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    int one = 1;
    setsockopt(listener.get(), SOL_SOCKET, SO_REUSEADDR, &one, sizeof one);
    if (bind(listener.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0 ||
        listen(listener.get(), 1) != 0)
      return *error = Errno("listen"), -1;
    SetTimeouts(listener.get(), 5000);
  }
  {
    InNamespace in(t.W());
    if (!in.ok()) return *error = "cannot enter the WAN namespace", -1;
    client.Reset(socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    SetTimeouts(client.get(), 5000);
    if (connect(client.get(), reinterpret_cast<sockaddr*>(&addr), sizeof addr) != 0)
      return *error = Errno("connect"), -1;
  }
  Socket server(accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (server.get() < 0) return *error = Errno("accept"), -1;
  SetTimeouts(server.get(), 1000);
  SetTimeouts(client.get(), 1000);

  const Clock::time_point start = Clock::now();
  std::thread sender([&] {
    std::vector<char> chunk(64 * 1024, 'x');
    long long sent = 0;
    while (Since(start) < limits.seconds && sent < limits.maxBytes) {
      ssize_t n = send(client.get(), chunk.data(), chunk.size(), MSG_NOSIGNAL);
      if (n > 0) sent += n;
      if (n < 0 && errno != EAGAIN && errno != EWOULDBLOCK && errno != EINTR) break;
    }
    shutdown(client.get(), SHUT_WR);
  });

  std::vector<char> buf(256 * 1024);
  long long measured = 0;
  double first = -1, last = -1;
  // The receiver gives up a little after the sender must have stopped.
  while (Since(start) < limits.seconds + 3) {
    ssize_t n = recv(server.get(), buf.data(), buf.size(), 0);
    if (n == 0) break;
    if (n < 0) {
      if (errno == EINTR || errno == EAGAIN || errno == EWOULDBLOCK) continue;
      break;
    }
    double now = Since(start);
    if (now < limits.skipSeconds) continue;
    if (first < 0) first = now;
    last = now;
    measured += n;
  }
  sender.join();
  if (first < 0 || last <= first) {
    *error = "too little data arrived to measure a rate";
    return -1;
  }
  // Bytes that arrived after the first measured read, over the time they took.
  return static_cast<double>(measured) / 1000.0 / (last - limits.skipSeconds);
}

bool SendUdp(const Topology& t, const std::string& dstAddr, uint16_t dstPort, uint16_t srcPort,
             int count, std::string* error) {
  InNamespace in(t.W());
  if (!in.ok()) return *error = "cannot enter the WAN namespace", false;
  const bool v6 = dstAddr.find(':') != std::string::npos;
  sockaddr_storage dst{}, src{};
  socklen_t len;
  if (v6) {
    auto* d = reinterpret_cast<sockaddr_in6*>(&dst);
    auto* s = reinterpret_cast<sockaddr_in6*>(&src);
    d->sin6_family = s->sin6_family = AF_INET6;
    d->sin6_port = htons(dstPort);
    s->sin6_port = htons(srcPort);
    if (inet_pton(AF_INET6, dstAddr.c_str(), &d->sin6_addr) != 1)
      return *error = "bad address", false;
    len = sizeof(sockaddr_in6);
  } else {
    auto* d = reinterpret_cast<sockaddr_in*>(&dst);
    auto* s = reinterpret_cast<sockaddr_in*>(&src);
    d->sin_family = s->sin_family = AF_INET;
    d->sin_port = htons(dstPort);
    s->sin_port = htons(srcPort);
    if (inet_pton(AF_INET, dstAddr.c_str(), &d->sin_addr) != 1)
      return *error = "bad address", false;
    len = sizeof(sockaddr_in);
  }
  Socket s(socket(v6 ? AF_INET6 : AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (s.get() < 0 || bind(s.get(), reinterpret_cast<sockaddr*>(&src), len) != 0)
    return *error = Errno("bind"), false;
  char payload[100] = {};
  for (int i = 0; i < count; ++i) {
    if (sendto(s.get(), payload, sizeof payload, 0, reinterpret_cast<sockaddr*>(&dst), len) < 0)
      return *error = Errno("sendto"), false;
    std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  return true;
}

}  // namespace kerneltest
