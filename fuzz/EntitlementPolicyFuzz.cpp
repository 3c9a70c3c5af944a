// Feeds one input to the entitlements policy as a file of the policy folder,
// beside a fixed file that grants this process's user two entitlements, and
// asks what a peer of this user holds. A file that does not pass (not a
// property list, another shape, an unknown user or group) grants nothing
// and never takes away what another file grants; whatever is granted beyond
// the fixed file's entitlements is in the input's own "entitlements".
// Also replayed over its corpus in the normal test run.

#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>

#include "ipc/EntitlementPolicy.h"
#include "platform/PropertyList.h"

namespace {

namespace fs = std::filesystem;

void replaceFile(const fs::path& path, std::string_view contents) {
  const auto temporary = path.string() + ".new";
  std::ofstream(temporary, std::ios::binary | std::ios::trunc)
      .write(contents.data(), static_cast<std::streamsize>(contents.size()));
  fs::rename(temporary, path);
}

// A scratch policy folder with the fixed file in it, made once per process
// and removed at its exit.
struct ScratchFolder {
  ScratchFolder() {
    std::string scratch = (fs::temp_directory_path() / "entitlement-policy-fuzz-XXXXXX").string();
    if (::mkdtemp(scratch.data()) == nullptr) {
      std::abort();
    }
    root = scratch;
    policies = root / "entitlements.d";
    fs::create_directories(policies);
    replaceFile(policies / "0-fixed.plist",
                "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<plist version=\"1.0\"><dict>"
                "<key>users</key><array><integer>" + std::to_string(::getuid()) + "</integer></array>"
                "<key>entitlements</key><dict><key>fixed.one</key><true/><key>fixed.two</key><string>2</string></dict>"
                "</dict></plist>\n");
  }
  ~ScratchFolder() {
    std::error_code ignored;
    fs::remove_all(root, ignored);
  }
  fs::path root;
  fs::path policies;
};

const fs::path& policyFolder() {
  static const ScratchFolder folder;
  return folder.policies;
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace zerith;
  const fs::path& folder = policyFolder();
  replaceFile(folder / "1-input.plist", std::string_view(reinterpret_cast<const char*>(data), size));

  const ipc::EntitlementPolicy policy(folder);
  ipc::PeerCredentials peer;
  peer.uid = ::getuid();
  peer.gid = ::getgid();
  const Dictionary granted = policy.entitlementsFor(peer);

  if (!granted.contains("fixed.one") || !granted.contains("fixed.two")) {
    std::abort();  // another file took away what the fixed one grants
  }
  const auto input = plist::decode(plist::Bytes(data, size), plist::Limits{1u << 20, 16, 100000});
  const Value entitlements = input && input->isDict() ? (*input)["entitlements"] : Value();
  for (const auto& [key, value] : granted) {
    const bool fixed = key == "fixed.one" || key == "fixed.two";
    if (!fixed && (!entitlements.dict() || entitlements[key] != value)) {
      std::abort();  // granted by no file
    }
  }
  return 0;
}
