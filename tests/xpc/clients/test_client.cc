// A small client of the message service for the tests. Built several times
// with different entitlements embedded; the tests run copies of it with the
// ownership and mode they need.
//
//   test_client SOCKET              connect, wait for the server's greeting,
//                                   send {"ping": true}, wait for one reply
//   test_client SOCKET --exec PATH  connect, wait for the greeting, then exec
//                                   PATH --fd N with the connected socket
//   test_client --fd N              send the ping on socket N, wait for a reply
//
// Exit status 0 when a reply (or the end of the connection) came, 2 on a
// usage error, 3 when connecting or talking failed.
#include <fcntl.h>
#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "xpc/client.h"

namespace {

constexpr auto kTimeout = std::chrono::seconds(20);

int PingAndWait(vtr::XpcClient& client) {
  if (!client.send(vtr::XpcObject::Dictionary({{"ping", vtr::XpcObject::Bool(true)}}))) return 3;
  vtr::Result<vtr::XpcObject> reply = client.receive(kTimeout);
  return reply || reply.error().code() == ECONNRESET ? 0 : 3;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc == 3 && std::string(argv[1]) == "--fd") {
    vtr::XpcClient client{vtr::UniqueFd(std::atoi(argv[2]))};
    return PingAndWait(client);
  }
  if (argc != 2 && !(argc == 4 && std::string(argv[2]) == "--exec")) {
    std::fprintf(stderr, "usage: %s SOCKET [--exec PATH] | --fd N\n", argv[0]);
    return 2;
  }
  vtr::Result<vtr::XpcClient> client = vtr::XpcClient::Connect(argv[1]);
  if (!client) return 3;
  if (!client->receive(kTimeout)) return 3;  // the greeting
  if (argc == 2) return PingAndWait(*client);

  int fd = client->fd();
  ::fcntl(fd, F_SETFD, 0);  // keep the socket across exec
  std::string fdText = std::to_string(fd);
  ::execl(argv[3], argv[3], "--fd", fdText.c_str(), static_cast<char*>(nullptr));
  return 3;
}
