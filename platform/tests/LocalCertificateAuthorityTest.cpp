#include <gtest/gtest.h>

#include "platform/LocalCertificateAuthority.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

namespace fs = std::filesystem;

// Every TLS test handshakes with what this CA issues; what no handshake
// shows: a key file others can read, a failed write taken for done, and a
// name that is no address taken for one.
TEST(LocalCertificateAuthorityTest, KeyFileIsPrivateAndFailuresAreReported) {
  const std::chrono::seconds hour = std::chrono::hours(1);
  std::string error;
  auto ca = LocalCertificateAuthority::create("test CA", hour, &error);
  ASSERT_TRUE(ca) << error;
  auto server = ca->issueServerCertificate({"localhost"}, {"127.0.0.1"}, hour, &error);
  ASSERT_TRUE(server) << error;

  test::TempRoot root;
  ASSERT_TRUE(ca->writeFiles(root.path(), *server));
  EXPECT_EQ(fs::status(root.path() / "key.pem").permissions(), fs::perms(0600));
  EXPECT_EQ(fs::status(root.path() / "ca.pem").permissions(), fs::perms(0644));
  EXPECT_FALSE(ca->writeFiles(root.path() / "missing", *server));

  EXPECT_FALSE(ca->issueServerCertificate({}, {"localhost"}, hour, &error));
  EXPECT_EQ(error, "cannot make a server certificate for localhost");
}

}  // namespace
}  // namespace zerith
