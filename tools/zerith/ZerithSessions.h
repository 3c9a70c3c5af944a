#pragma once

// `zerith sessions`: several sessions driven by one script of JSON lines, one
// command per line, run as each line arrives (so a shell can feed it from a
// pipe and react to what it prints). Every session is its own connection to
// the daemon; the lines name the session they act on:
//
//   {"session":"root","step":"open","clientType":7,"sessionID":1,
//    "hierarchyToken":"call","hierarchyLevel":0,"aggregation":true}
//   {"session":"root","step":"start"}
//   {"session":"root","step":"shared-data","dictionary":{"room":"blue"}}
//   {"session":"child","step":"send","category":20,"type":3,"payload":{"x":1}}
//   {"session":"child","step":"flush"}
//   {"step":"wait","ms":100}
//   {"session":"child","step":"close"}
//
// Steps: open (clientType, sessionID, and optionally userInfo, sessionInfo,
// requireUserInfo, hierarchyToken, hierarchyLevel, aggregation, setInfo:false
// to connect without setSessionInfo), start, states (userInfo), display-url,
// send and one-shot (category, type, payload), flush, shared-data
// (dictionary), shared-key (key, value; null or none removes it), finish,
// close, wait (ms). Blank lines and lines starting with # are skipped.
//
// Output: one JSON line per step with "session", "step" and the answer's
// arguments; messages from the daemon as {"session":...,"event":"message",...}
// lines whenever they arrive. A step that fails prints "failure" and ends the
// script with status 5 (a flush answering an error counts as failed); a line
// that cannot run as written ends it with status 2.

#include <chrono>
#include <filesystem>
#include <istream>
#include <ostream>

namespace zerith::cli {

int runSessions(std::istream& script, const std::filesystem::path& socket, std::chrono::milliseconds timeout,
                std::ostream& out, std::ostream& err);

}  // namespace zerith::cli
