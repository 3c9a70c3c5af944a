#include "ipc/EntitlementPolicy.h"

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <cerrno>
#include <limits>

#include <fmt/format.h>

#include "platform/FileUtil.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace zerith::ipc {

namespace {

constexpr std::size_t kMaxPolicyFileBytes = 1u << 20;

struct Lookup {
  std::optional<unsigned> id;
  std::string error;
};

// getpwnam_r / getgrnam_r with a buffer that grows when the entry needs more.
template <typename Entry, typename Fn>
Lookup lookupName(const std::string& name, Fn fn, const char* what) {
  std::vector<char> buffer(1024);
  for (;;) {
    Entry entry{};
    Entry* result = nullptr;
    const int rc = fn(name.c_str(), &entry, buffer.data(), buffer.size(), &result);
    if (rc == ERANGE && buffer.size() < (1u << 20)) {
      buffer.resize(buffer.size() * 2);
      continue;
    }
    if (rc != 0) {
      return {std::nullopt, std::string("cannot look up ") + what + " \"" + name + "\": " +
                                std::error_code(rc, std::generic_category()).message()};
    }
    if (!result) {
      return {std::nullopt, std::string("unknown ") + what + " \"" + name + "\""};
    }
    if constexpr (std::is_same_v<Entry, passwd>) {
      return {entry.pw_uid, {}};
    } else {
      return {entry.gr_gid, {}};
    }
  }
}

Lookup resolve(const Value& entry, bool user) {
  const char* what = user ? "user" : "group";
  if (const auto* name = entry.string()) {
    return user ? lookupName<passwd>(*name, ::getpwnam_r, what) : lookupName<group>(*name, ::getgrnam_r, what);
  }
  if (entry.type() == Value::Type::Int || entry.type() == Value::Type::UInt) {
    const auto id = entry.intValue();
    // (uid_t)-1 means "no id" to the kernel; never a real user.
    if (entry.type() == Value::Type::Int && id >= 0 && id < std::numeric_limits<std::uint32_t>::max()) {
      return {static_cast<unsigned>(id), {}};
    }
  }
  return {std::nullopt, std::string("a ") + what + " entry is neither a name nor an id: " + entry.description()};
}

// The ids of one list ("users" or "groups"); an error ends the file.
bool resolveList(const Value& file, const char* key, bool user, std::vector<unsigned>& ids, std::string& why) {
  const Value list = file[key];
  if (list.isNil()) {
    return true;
  }
  const auto* array = list.array();
  if (!array) {
    why = std::string("\"") + key + "\" is not an array";
    return false;
  }
  for (const auto& entry : *array) {
    auto lookup = resolve(entry, user);
    if (!lookup.id) {
      why = std::move(lookup.error);
      return false;
    }
    ids.push_back(*lookup.id);
  }
  return true;
}

bool contains(const std::vector<unsigned>& ids, unsigned id) { return std::find(ids.begin(), ids.end(), id) != ids.end(); }

}  // namespace

EntitlementPolicy::EntitlementPolicy(std::filesystem::path folder) : folder_(std::move(folder)) {}

std::filesystem::path EntitlementPolicy::folder() const { return folder_ ? *folder_ : paths::entitlementsDir(); }

Dictionary EntitlementPolicy::entitlementsFor(const PeerCredentials& peer) const { return evaluate(&peer, nullptr); }

std::vector<std::string> EntitlementPolicy::problems() const {
  std::vector<std::string> found;
  evaluate(nullptr, &found);
  return found;
}

Dictionary EntitlementPolicy::evaluate(const PeerCredentials* peerOrNull, std::vector<std::string>* problems) const {
  namespace fs = std::filesystem;
  const fs::path dir = folder();
  Dictionary granted;
  std::error_code ec;
  if (!fs::exists(dir, ec) && !ec) {
    log_.debug("EntitlementPolicy: no policy folder {}; nothing is granted", dir.string());
    return granted;
  }
  std::vector<fs::path> files;
  fs::directory_iterator it(dir, ec);
  for (; !ec && it != fs::directory_iterator(); it.increment(ec)) {
    if (it->path().extension() == ".plist") {
      files.push_back(it->path());
    }
  }
  if (ec) {
    const std::string why = fmt::format("cannot read the policy folder {}: {}; nothing is granted", dir.string(),
                                        ec.message());
    problems ? problems->push_back(why) : log_.error("EntitlementPolicy: {}", why);
    return Dictionary();
  }
  std::sort(files.begin(), files.end());

  for (const auto& path : files) {
    auto reject = [&](const std::string& why) {
      const std::string line = fmt::format("{}: {}; the file grants nothing", path.string(), why);
      problems ? problems->push_back(line) : log_.error("EntitlementPolicy: {}", line);
    };
    const auto bytes = file::readAll(path, kMaxPolicyFileBytes);
    if (!bytes) {
      reject("cannot be read or is larger than 1 MiB");
      continue;
    }
    std::string why;
    const auto policy = plist::decode(plist::bytesOf(*bytes), plist::Limits{kMaxPolicyFileBytes, 16, 100000}, &why);
    if (!policy) {
      reject("not a property list: " + why);
      continue;
    }
    if (!policy->isDict()) {
      reject("not a dictionary");
      continue;
    }
    const Value fileEntitlements = (*policy)["entitlements"];
    const auto* entitlements = fileEntitlements.dict();
    if (!entitlements) {
      reject("\"entitlements\" is missing or not a dictionary");
      continue;
    }
    std::vector<unsigned> users;
    std::vector<unsigned> groups;
    if (!resolveList(*policy, "users", true, users, why) || !resolveList(*policy, "groups", false, groups, why)) {
      reject(why);
      continue;
    }
    if (!peerOrNull) {
      continue;
    }
    const PeerCredentials& peer = *peerOrNull;
    bool listed = contains(users, peer.uid) || contains(groups, peer.gid);
    for (const gid_t g : peer.groups) {
      listed = listed || contains(groups, g);
    }
    if (!listed) {
      continue;
    }
    for (const auto& [key, value] : *entitlements) {
      granted.set(key, value);
    }
  }
  return granted;
}

}  // namespace zerith::ipc
