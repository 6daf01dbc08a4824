// The floor of a call, a program as the daemon is one, so that the scheduler treats it the same way: answers
// so many bytes for so many, on the connections of the listening socket that is its standard input, with so
// many threads that wait on a one-shot epoll set.
#include <sys/epoll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdlib>
#include <thread>

namespace {

struct Server {
  std::size_t request, reply;
  int epoll = ::epoll_create1(EPOLL_CLOEXEC);

  void wait(int operation, int descriptor) const {
    epoll_event event{EPOLLIN | EPOLLONESHOT, {.fd = descriptor}};
    ::epoll_ctl(epoll, operation, descriptor, &event);
  }

  void serve() const {
    char buffer[65536] = {};
    for (epoll_event event; ::epoll_wait(epoll, &event, 1, -1) == 1;) {
      const int socket = event.data.fd;
      if (socket == STDIN_FILENO) {
        wait(EPOLL_CTL_ADD, ::accept4(socket, nullptr, nullptr, SOCK_NONBLOCK | SOCK_CLOEXEC));
      } else if (::recv(socket, buffer, request, 0) <= 0) {
        ::close(socket);
        continue;
      } else {
        ::send(socket, buffer, reply, MSG_NOSIGNAL);
      }
      wait(EPOLL_CTL_MOD, socket);
    }
  }
};

}  // namespace

int main(int argc, char** argv) {
  if (argc != 4) return 2;
  const Server server{std::strtoul(argv[1], nullptr, 10), std::strtoul(argv[2], nullptr, 10)};
  server.wait(EPOLL_CTL_ADD, STDIN_FILENO);
  for (unsigned long i = 1; i < std::strtoul(argv[3], nullptr, 10); ++i) {
    std::thread([&] { server.serve(); }).detach();
  }
  server.serve();
}
