// The socket's file, and sockets that others made.
#include <fcntl.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <variant>
#include <vector>

#include "ServerFixture.h"
#include "platform/linux/base/Descriptors.h"
#include "platform/linux/base/UnixSocket.h"
#include "tests/support/ChildProcess.h"

namespace kyt {
namespace {

using test::PlainClient;
using test::Server;

TEST(UnixSocketAcceptor, TakesThePlaceOfAStaleSocketButNotOfALiveOneOrAFile) {
  Server server;
  auto live = UnixSocketAcceptor::bindAt(server.path);
  ASSERT_TRUE(std::holds_alternative<Error>(live));
  EXPECT_NE(std::get<Error>(live).localizedDescription.find("Another process listens"), std::string::npos);

  const std::string stale = server.folder + "/stale";
  {
    const Descriptor socket = ownDescriptor(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::memcpy(address.sun_path, stale.data(), stale.size());
    ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  }
  {
    auto bound = UnixSocketAcceptor::bindAt(stale);
    ASSERT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(bound));
    PlainClient client(stale);
    EXPECT_TRUE(client.connected());
  }
  EXPECT_FALSE(std::filesystem::exists(stale)) << "it removes what it made";

  const std::string file = server.folder + "/file";
  const Descriptor made = ownDescriptor(::open(file.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, 0600));
  EXPECT_TRUE(std::holds_alternative<Error>(UnixSocketAcceptor::bindAt(file)));
  EXPECT_TRUE(std::filesystem::exists(file));
}

TEST(UnixSocketAcceptor, RefusesAPathOver107Bytes) {
  auto bound = UnixSocketAcceptor::bindAt("/tmp/" + std::string(103, 'x'));
  ASSERT_TRUE(std::holds_alternative<Error>(bound));
  EXPECT_NE(std::get<Error>(bound).localizedDescription.find("longer than 107 bytes"), std::string::npos);
  auto fits = UnixSocketAcceptor::bindAt("/tmp/" + std::string(90, 'k') + std::to_string(::getpid()));
  EXPECT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(fits));
}

TEST(UnixSocketAcceptor, AdoptsOnlyAListeningUnixSocket) {
  int pair[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
  const Descriptor other = ownDescriptor(pair[1]);
  EXPECT_TRUE(std::holds_alternative<Error>(UnixSocketAcceptor::adopt(ownDescriptor(pair[0]))));

  const std::string path = "/tmp/kyt-ipc-adopt-" + std::to_string(::getpid());
  auto bound = UnixSocketAcceptor::bindAt(path);
  auto& listening = std::get<std::unique_ptr<UnixSocketAcceptor>>(bound);
  auto adopted = UnixSocketAcceptor::adopt(ownDescriptor(::dup(listening->descriptor())));
  ASSERT_TRUE(std::holds_alternative<std::unique_ptr<UnixSocketAcceptor>>(adopted));
  EXPECT_TRUE(std::get<0>(adopted)->activated());
  PlainClient client(path);
  std::unique_ptr<Stream> stream;
  EXPECT_EQ(std::get<0>(adopted)->accept(stream), AcceptStatus::accepted);
  const PeerCredentials peer = stream->peer();
  EXPECT_EQ(peer.pid, ::getpid());
  EXPECT_EQ(peer.uid, ::getuid());
  std::vector<gid_t> groups(static_cast<size_t>(::getgroups(0, nullptr)));
  ASSERT_GE(::getgroups(static_cast<int>(groups.size()), groups.data()), 0);
  EXPECT_EQ(peer.groups, groups);
}

// What a service manager does before it starts the daemon: socket 3, and the variables that say so.
std::string adoptInChild(int socket, const std::string& count, bool ours) {
  return inChildProcess([&]() -> std::string {
    if (::dup2(socket, 3) != 3) return "dup2 failed";
    ::setenv("LISTEN_FDS", count.c_str(), 1);
    ::setenv("LISTEN_PID", std::to_string(ours ? ::getpid() : 1).c_str(), 1);
    auto adopted = UnixSocketAcceptor::adoptActivated();
    if (const Error* error = std::get_if<Error>(&adopted)) return error->localizedDescription;
    if (std::get<0>(adopted) == nullptr) return "none";
    if (::getenv("LISTEN_FDS") != nullptr) return "the variables are still there";
    if ((::fcntl(3, F_GETFD) & FD_CLOEXEC) == 0) return "not closed on exec";
    return (::fcntl(3, F_GETFL) & O_NONBLOCK) != 0 ? "adopted" : "it blocks";
  });
}

TEST(UnixSocketAcceptor, AdoptsTheSocketOfTheServiceManager) {
  const std::string path = "/tmp/kyt-ipc-activated-" + std::to_string(::getpid());
  auto bound = UnixSocketAcceptor::bindAt(path);
  const int socket = std::get<std::unique_ptr<UnixSocketAcceptor>>(bound)->descriptor();
  EXPECT_EQ(adoptInChild(socket, "1", true), "adopted");
  EXPECT_EQ(adoptInChild(socket, "1", false), "none") << "meant for another process";
  EXPECT_NE(adoptInChild(socket, "2", true).find("passed 2 sockets"), std::string::npos);
  EXPECT_NE(adoptInChild(2, "1", true).find("no listening Unix stream socket"), std::string::npos);
}

}  // namespace
}  // namespace kyt
