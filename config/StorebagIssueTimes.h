#pragma once

// Anti-rollback for storebags. `zerith-storebag sign` stamps the bag proper
// with its issue time ("issue_time", a property-list date), so the signature
// covers it. The daemon remembers, per storebag name and across restarts, the
// newest issue time it has accepted and refuses a bag issued before it.
//
// The remembered times live in one file of the daemon's state folder
// (/var/lib/zerithd/storebag-issue-times.plist): a property list dictionary,
// storebag name -> date, replaced atomically. The file is read as untrusted
// bytes (size, structure and every entry checked) and read afresh at every
// check, so the operator's `zerith-storebag forget-issue-time` takes effect
// at the next fetch. A lock file beside it serialises the daemon and the
// tool; each waits for it a bounded time.

#include <filesystem>
#include <map>
#include <optional>
#include <string>

#include "platform/DefaultsKeys.h"
#include "platform/PropertyList.h"
#include "platform/Value.h"

namespace zerith {

// The bag's key of the issue time.
inline constexpr const char* kStorebagIssueTimeKey = "issue_time";
// Defaults key (domain com.velmar.zerith): when true, a bag without an issue
// time is refused.
inline constexpr std::string_view kRequireStorebagIssueTimeKey = defaultsSetting("storebag_require_issue_time").key;

using StorebagIssueTimes = std::map<std::string, Date>;

std::filesystem::path storebagIssueTimesFile();

// Largest file read back: room for a few hundred names.
inline constexpr std::size_t kMaxStorebagIssueTimesBytes = 64u << 10;

// The remembered times of a file's bytes, or nullopt with `why` (not a
// property list, not a dictionary, an entry that is not a date, too large).
std::optional<StorebagIssueTimes> decodeStorebagIssueTimes(plist::Bytes bytes, std::string* why = nullptr);
Data encodeStorebagIssueTimes(const StorebagIssueTimes& times);

// The issue time of a decoded bag: nullopt without the key; `unusable` is set
// (with its cause) when the key holds something other than a date.
std::optional<Date> storebagIssueTime(const Value& bag, std::string* unusable);

// Whether the defaults require an issue time.
bool storebagIssueTimeRequired();

// Every remembered time, or nullopt with `why` when the file cannot be read
// or fails its checks (no file: none remembered).
std::optional<StorebagIssueTimes> rememberedStorebagIssueTimes(std::string* why);
// The newest issue time accepted for `name`, nullopt when none is known. A
// file that cannot be read or fails its checks counts as empty (logged).
std::optional<Date> rememberedStorebagIssueTime(const std::string& name);
// Raises the remembered time of `name` to `issued` (never lowers it). False
// (logged) when the file cannot be written.
bool rememberStorebagIssueTime(const std::string& name, Date issued);
// The operator's way back: forgets the time of `name`. Gives back the time
// it had (nullopt when none); false with `error` when the file cannot be read
// or written.
bool forgetStorebagIssueTime(const std::string& name, std::optional<Date>& forgotten, std::string* error);

// A date as the logs show it: "2026-05-01 12:00:00 +0000" (UTC, whole seconds).
std::string describeIssueTime(Date date);

}  // namespace zerith
