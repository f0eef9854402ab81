#include "Platform/ipc/server/Peer.h"

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/wait.h>

#include "Platform/ipc/SocketPath.h"
#include "Tests/Platform/os/TestRoot.h"

namespace platform::ipc {
namespace {

TEST(PeerTest, AProcessThatHasEndedIsNobody) {
  TestRoot root;
  const Tasks tasks(root.files());
  const auto listener = listenAt(root.path("service"), SOCK_STREAM, 0666);
  ASSERT_TRUE(listener);
  const std::string path = root.path("service");
  const pid_t child = ::fork();
  if (child == 0) ::_exit(connectTo(path, SOCK_STREAM) ? 0 : 1);
  ASSERT_GT(child, 0);
  siginfo_t info{};
  ASSERT_EQ(::waitid(P_PID, static_cast<id_t>(child), &info, WEXITED | WNOWAIT), 0);
  const FileDescriptor connection(::accept4(listener->get(), nullptr, nullptr, SOCK_CLOEXEC));
  ASSERT_TRUE(connection.valid());
  if (kernelHasPeerDescriptors()) {
    EXPECT_EQ(identifyPeer(connection.get(), tasks).error().value, ESRCH);  // a zombie
  }
  ASSERT_EQ(::waitpid(child, nullptr, 0), child);
  EXPECT_EQ(identifyPeer(connection.get(), tasks).error().value, ESRCH);
}

}  // namespace
}  // namespace platform::ipc
