#include "ipc/EntitlementPolicy.h"

#include <gtest/gtest.h>

#include "platform/Log.h"
#include "platform/PropertyList.h"
#include "tests/support/TempRoot.h"

namespace zerith::ipc {
namespace {

constexpr uid_t kUser = 41001;
constexpr gid_t kGroup = 42001;
constexpr gid_t kExtraGroup = 42002;

PeerCredentials peer(uid_t uid, gid_t gid, std::vector<gid_t> groups = {}) {
  return PeerCredentials{1234, uid, gid, std::move(groups)};
}

std::string xmlPolicy(const std::string& users, const std::string& groups, const std::string& entitlements) {
  return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\">\n<dict>\n"
         "<key>users</key><array>" + users + "</array>\n"
         "<key>groups</key><array>" + groups + "</array>\n"
         "<key>entitlements</key><dict>" + entitlements + "</dict>\n</dict>\n</plist>\n";
}

const std::string kAdmit = "<key>com.velmar.private.zerithd</key><true/>";

struct EntitlementPolicyTest : ::testing::Test {
  zerith::test::TempRoot root;
  EntitlementPolicy policy;
  void write(const std::string& name, const std::string& contents) {
    root.write("/etc/zerithd/entitlements.d/" + name, contents);
  }
};

TEST_F(EntitlementPolicyTest, ListedUserByIdOrNameAndPrimaryOrSupplementaryGroupAreGrantedOthersAreNot) {
  write("by-id.plist", xmlPolicy("<integer>41001</integer>", "", kAdmit));
  write("by-name.plist", xmlPolicy("<string>root</string>", "", "<key>by-name</key><true/>"));
  write("group.plist", xmlPolicy("", "<integer>42002</integer><string>root</string>", "<key>by-group</key><true/>"));
  EXPECT_EQ(policy.entitlementsFor(peer(kUser, 1)), (Dictionary{{kZerithdEntitlement, true}}));
  EXPECT_EQ(policy.entitlementsFor(peer(0, 1)), (Dictionary{{"by-name", true}}));
  EXPECT_TRUE(policy.entitlementsFor(peer(kUser + 1, 1)).empty());
  const Dictionary byGroup{{"by-group", true}};
  EXPECT_EQ(policy.entitlementsFor(peer(kUser + 1, kExtraGroup)), byGroup);
  EXPECT_EQ(policy.entitlementsFor(peer(kUser + 1, kGroup, {7, kExtraGroup})), byGroup);
  EXPECT_EQ(policy.entitlementsFor(peer(kUser + 1, kGroup, {0})), byGroup);
  EXPECT_TRUE(policy.entitlementsFor(peer(kUser + 1, kGroup, {7, 8})).empty());
}

TEST_F(EntitlementPolicyTest, ValuesArePassedAsWrittenSoFalseAndNonBooleansReachTheDecision) {
  write("a.plist", xmlPolicy("<integer>41001</integer>", "", "<key>com.velmar.private.zerithd</key><false/>"));
  write("b.plist", xmlPolicy("<integer>41002</integer>", "", "<key>com.velmar.private.zerithd</key><string>true</string>"));
  write("c.plist", xmlPolicy("<integer>41003</integer>", "", "<key>com.velmar.private.zerithd</key><integer>1</integer>"));
  EXPECT_EQ(policy.entitlementsFor(peer(41001, 1)).get(kZerithdEntitlement), Value(false));
  EXPECT_EQ(policy.entitlementsFor(peer(41002, 1)).get(kZerithdEntitlement), Value("true"));
  EXPECT_EQ(policy.entitlementsFor(peer(41003, 1)).get(kZerithdEntitlement), Value(1));
}

TEST_F(EntitlementPolicyTest, UnionOfFilesWithLaterFilesReplacingEarlierValues) {
  write("10-base.plist", xmlPolicy("<integer>41001</integer>", "", kAdmit + "<key>level</key><integer>1</integer>"));
  write("20-group.plist", xmlPolicy("", "<integer>42001</integer>", "<key>level</key><integer>2</integer><key>extra</key><true/>"));
  EXPECT_EQ(policy.entitlementsFor(peer(kUser, kGroup)),
            (Dictionary{{kZerithdEntitlement, true}, {"level", 2}, {"extra", true}}));
}

TEST_F(EntitlementPolicyTest, BinaryFilesCountAndOtherExtensionsAreIgnored) {
  const Value file(Dictionary{{"users", Array{Value(41001)}}, {"entitlements", Dictionary{{kZerithdEntitlement, true}}}});
  const Data binary = plist::encodeBinary(file);
  write("bin.plist", std::string(binary.begin(), binary.end()));
  write("notes.txt", xmlPolicy("<integer>41002</integer>", "", kAdmit));
  write("old.plist.bak", xmlPolicy("<integer>41002</integer>", "", kAdmit));
  EXPECT_EQ(policy.entitlementsFor(peer(41001, 1)).get(kZerithdEntitlement), Value(true));
  EXPECT_TRUE(policy.entitlementsFor(peer(41002, 1)).empty());
}

TEST_F(EntitlementPolicyTest, BrokenFilesAreLoggedAndGrantNothingWhileGoodOnesStillCount) {
  log::LogCapture capture;
  const auto dir = (root / "/etc/zerithd/entitlements.d").string();
  write("1-corrupt.plist", "<?xml version=\"1.0\"?><plist><dict><key>users</key><array><integer>41001");
  write("2-not-dict.plist", "<?xml version=\"1.0\"?><plist><array/></plist>");
  write("3-unknown-user.plist", xmlPolicy("<integer>41001</integer><string>no-such-zerith-user</string>", "", kAdmit));
  write("4-bad-entry.plist", xmlPolicy("<real>41001</real>", "", kAdmit));
  write("5-no-entitlements.plist",
        "<?xml version=\"1.0\"?><plist><dict><key>users</key><array><integer>41001</integer></array></dict></plist>");
  write("6-good.plist", xmlPolicy("<integer>41001</integer>", "", "<key>good</key><true/>"));
  // The peer's group 1 is listed, but an unknown group name spoils the file.
  write("7-unknown-group.plist", xmlPolicy("", "<integer>1</integer><string>no-such-zerith-group</string>", kAdmit));

  EXPECT_EQ(policy.entitlementsFor(peer(41001, 1)), (Dictionary{{"good", true}}));
  EXPECT_TRUE(capture.contains("EntitlementPolicy: " + dir + "/1-corrupt.plist: not a property list: "));
  const auto refused = [&](const std::string& file, const std::string& why) {
    return capture.has(log::Level::Error, "EntitlementPolicy: " + dir + "/" + file + ": " + why + "; the file grants nothing");
  };
  EXPECT_TRUE(refused("2-not-dict.plist", "not a dictionary"));
  EXPECT_TRUE(refused("3-unknown-user.plist", "unknown user \"no-such-zerith-user\""));
  EXPECT_TRUE(refused("4-bad-entry.plist", "a user entry is neither a name nor an id: 41001"));
  EXPECT_TRUE(refused("5-no-entitlements.plist", "\"entitlements\" is missing or not a dictionary"));
  EXPECT_TRUE(refused("7-unknown-group.plist", "unknown group \"no-such-zerith-group\""));
  EXPECT_EQ(policy.problems().size(), 6u) << "the same six files, as zerithd --check names them";
}

TEST_F(EntitlementPolicyTest, MissingFolderGrantsNothingAndAnUnreadableOneIsLogged) {
  EXPECT_TRUE(policy.entitlementsFor(peer(0, 0)).empty());
  log::LogCapture capture;
  // A policy folder that is a file cannot be listed.
  root.write("/etc/zerithd/entitlements.d", "not a folder");
  EXPECT_TRUE(policy.entitlementsFor(peer(0, 0)).empty());
  EXPECT_TRUE(capture.contains("EntitlementPolicy: cannot read the policy folder"));
}

}  // namespace
}  // namespace zerith::ipc
