#include "daemon/KeepAliveTransaction.h"

#include <gtest/gtest.h>

#include <sys/socket.h>
#include <sys/un.h>

#include <cstdlib>
#include <cstring>
#include <thread>

#include "platform/FileUtil.h"
#include "tests/support/TempRoot.h"

namespace zerith::test {
namespace {

using namespace std::chrono_literals;

TEST(KeepAliveTransaction, DrainWaitEndsWhenTheTransactionEndsNotAtTheDeadline) {
  KeepAliveTransaction transaction;
  EXPECT_TRUE(transaction.waitUntilClosed(std::chrono::steady_clock::now()));  // nothing open

  transaction.begin();
  transaction.begin();  // a second begin while open: still one open transaction

  std::thread ender([&] { transaction.end(); });
  // Woken by the end, long before this deadline (a wait that reaches its
  // deadline is the end-to-end stop time-out test's).
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(transaction.waitUntilClosed(start + 60s));
  EXPECT_LT(std::chrono::steady_clock::now() - start, 30s);
  ender.join();
  EXPECT_FALSE(transaction.isOpen());
  EXPECT_EQ(transaction.beginCount(), 2u);
  EXPECT_EQ(transaction.endCount(), 1u);
}

TEST(KeepAliveTransaction, ReportsItsStateToTheServiceManager) {
  TempRoot root;
  const auto path = root.path() / "notify";
  file::UniqueFd socket(::socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  sockaddr_un addr{};
  addr.sun_family = AF_UNIX;
  std::strncpy(addr.sun_path, path.c_str(), sizeof(addr.sun_path) - 1);
  ASSERT_EQ(::bind(socket.get(), reinterpret_cast<sockaddr*>(&addr), sizeof(addr)), 0);
  ::setenv("NOTIFY_SOCKET", path.c_str(), 1);

  KeepAliveTransaction transaction;
  transaction.begin();
  transaction.end();
  ::unsetenv("NOTIFY_SOCKET");

  auto next = [&] {
    char buf[256];
    const ssize_t n = ::recv(socket.get(), buf, sizeof buf, MSG_DONTWAIT);
    return n > 0 ? std::string(buf, static_cast<std::size_t>(n)) : std::string();
  };
  EXPECT_EQ(next(), "STATUS=Serving sessions (keep-alive transaction open)");
  EXPECT_EQ(next(), "STATUS=Idle (no keep-alive transaction)");
}

}  // namespace
}  // namespace zerith::test
