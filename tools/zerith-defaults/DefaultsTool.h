#pragma once

// The commands of zerith-defaults, apart from option parsing:
//
//   read DOMAIN            the whole domain as an XML property list
//   read DOMAIN KEY        a string, number or boolean (1/0) as plain text,
//                          a date as "YYYY-MM-DD hh:mm:ss +0000", anything
//                          else as an XML property list
//   write DOMAIN KEY [-string|-int|-integer|-bool|-boolean|-real|-float] VALUE
//                          a typed value (a string without a type)
//   delete DOMAIN [KEY]    one key, or the whole domain
//   check [DOMAIN...]      keys the daemon does not read and values its
//                          readers refuse, in the named domains or in every
//                          domain it reads; status 1 when there is one

#include <iosfwd>
#include <string>
#include <vector>

namespace zerith::tool {

// Exit statuses.
inline constexpr int kOk = 0;
inline constexpr int kNotFound = 1;  // no such domain or key, a failed write, or a problem that check found
inline constexpr int kUsage = 2;     // bad command line or value

// Runs one command (its words after the program's own options); output goes
// to `out`, messages to `err`. Paths are those of the current paths root.
int runDefaultsCommand(const std::vector<std::string>& words, std::ostream& out, std::ostream& err);

std::string usage();

}  // namespace zerith::tool
