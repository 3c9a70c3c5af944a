#include <gtest/gtest.h>

#include "platform/Defaults.h"
#include "platform/Log.h"
#include "tests/support/TempRoot.h"

namespace zerith {
namespace {

// Writes, reads and deletes are checked through zerith-defaults
// (DefaultsToolTest); here what the tool cannot show: a reader that caches.
TEST(DefaultsTest, AFileAnotherProcessRewritesIsSeenByTheNextRead) {
  test::TempRoot root;
  Defaults d("com.velmar.zerith");
  ASSERT_TRUE(d.setObject("environmentType", 1));
  ASSERT_TRUE(d.setObject("zerith_storebag_url", "https://127.0.0.1:1/bags"));
  EXPECT_EQ(d.objectForKey("environmentType").intValue(), 1);
  root.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist",
             "<?xml version=\"1.0\"?><plist version=\"1.0\"><dict><key>environmentType</key><integer>-1</integer></dict></plist>");
  EXPECT_EQ(d.objectForKey("environmentType").intValue(), -1);
  EXPECT_TRUE(d.objectForKey("zerith_storebag_url").isNil());
}

TEST(DefaultsTest, CorruptFileReadsEmptyAndIsMovedAsideOnWrite) {
  test::TempRoot root;
  log::LogCapture capture;
  root.write("/var/lib/zerithd/defaults/com.velmar.zerith.plist", "<plist><dict><key>a</key><array>");
  Defaults d("com.velmar.zerith");
  EXPECT_TRUE(d.objectForKey("a").isNil());
  EXPECT_TRUE(capture.contains("ignoring corrupt defaults file"));
  ASSERT_TRUE(d.setObject("b", "x"));
  EXPECT_EQ(d.objectForKey("b").description(), "x");
  EXPECT_TRUE(std::filesystem::exists(root / "/var/lib/zerithd/defaults/com.velmar.zerith.plist.corrupt"));
}

}  // namespace
}  // namespace zerith
