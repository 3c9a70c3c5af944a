#include "ipc/DaemonStatus.h"

#include <fmt/format.h>

#include <algorithm>
#include <limits>

namespace zerith::ipc {

namespace {

// A binary property list carries integers as signed 64-bit values: a count
// beyond that comes back negative, so no larger one is taken.
constexpr std::uint64_t kMaxWireCount = static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max());

struct Refused {
  std::string why;
};

bool isInteger(const Value& v) { return v.type() == Value::Type::Int || v.type() == Value::Type::UInt; }

const Dictionary& dictionaryAt(const Value& v, const std::string& where) {
  const Dictionary* d = v.dict();
  if (!d) {
    throw Refused{fmt::format("{} is {}, not a dictionary", where, v.kindName())};
  }
  return *d;
}

const Array& arrayAt(const Dictionary& d, const char* key, const std::string& where) {
  const Value* v = d.find(key);
  const Array* a = v ? v->array() : nullptr;
  if (!a) {
    throw Refused{fmt::format("{}.{} is {}, not an array", where, key, v ? v->kindName() : "missing")};
  }
  return *a;
}

std::string nameAt(const Dictionary& d, const char* key, const std::string& where) {
  const Value* v = d.find(key);
  const std::string* s = v ? v->string() : nullptr;
  if (!s) {
    throw Refused{fmt::format("{}.{} is {}, not a string", where, key, v ? v->kindName() : "missing")};
  }
  if (s->size() > kStatusMaxNameBytes) {
    throw Refused{fmt::format("{}.{} is {} bytes long, more than {}", where, key, s->size(), kStatusMaxNameBytes)};
  }
  return *s;
}

std::uint64_t unsignedAt(const Dictionary& d, const char* key, const std::string& where, std::uint64_t max) {
  const Value* v = d.find(key);
  if (!v || !isInteger(*v) || (v->type() == Value::Type::Int && v->intValue() < 0) || v->unsignedValue() > max) {
    throw Refused{fmt::format("{}.{} is {}, not an integer from 0 to {}", where, key,
                              v ? v->description() : std::string("missing"), max)};
  }
  return v->unsignedValue();
}

std::int64_t signedAt(const Dictionary& d, const char* key, const std::string& where) {
  const Value* v = d.find(key);
  if (!v || !isInteger(*v) ||
      (v->type() == Value::Type::UInt && v->unsignedValue() > static_cast<std::uint64_t>(INT64_MAX))) {
    throw Refused{fmt::format("{}.{} is {}, not a signed 64-bit integer", where, key,
                              v ? v->description() : std::string("missing"))};
  }
  return v->intValue();
}

CountList countsAt(const Dictionary& d, const std::string& where) {
  const std::string here = where + ".counts";
  const Value* v = d.find("counts");
  if (!v) {
    throw Refused{here + " is missing"};
  }
  const Dictionary& counts = dictionaryAt(*v, here);
  if (counts.size() > kStatusMaxCounts) {
    throw Refused{fmt::format("{} has {} entries, more than {}", here, counts.size(), kStatusMaxCounts)};
  }
  CountList out;
  for (const auto& [name, value] : counts) {
    if (name.empty() || name.size() > kStatusMaxNameBytes) {
      throw Refused{fmt::format("{} has a count name of {} bytes", here, name.size())};
    }
    out.emplace_back(name, unsignedAt(counts, name.c_str(), here, kMaxWireCount));
  }
  return out;
}

Value countsValue(const CountList& counts) {
  Dictionary d;
  for (const auto& [name, value] : counts) {
    d.set(name, Value(static_cast<unsigned long long>(std::min(value, kMaxWireCount))));
  }
  return Value(std::move(d));
}

}  // namespace

std::uint64_t countOf(const CountList& counts, std::string_view name) {
  for (const auto& [n, value] : counts) {
    if (n == name) {
      return value;
    }
  }
  return 0;
}

Value DaemonStatus::toValue() const {
  Array liveSessions;
  for (const SessionStatus& s : sessions) {
    Array backends;
    for (const BackendStatus& b : s.backends) {
      backends.emplace_back(Dictionary{{"name", b.name},
                                       {"state", Value(static_cast<long long>(b.state))},
                                       {"counts", countsValue(b.counts)}});
    }
    liveSessions.emplace_back(Dictionary{{"sessionID", Value(unsigned{s.sessionID})},
                                         {"sessionIDString", s.sessionIDString},
                                         {"clientType", Value(static_cast<long long>(s.clientType))},
                                         {"backends", Value(std::move(backends))}});
  }
  Array endedTotals;
  for (const EndedTotals& e : ended) {
    endedTotals.emplace_back(Dictionary{{"clientType", Value(static_cast<long long>(e.clientType))},
                                        {"backend", e.backend},
                                        {"sessions", Value(static_cast<unsigned long long>(std::min(e.sessions, kMaxWireCount)))},
                                        {"counts", countsValue(e.counts)}});
  }
  return Value(Dictionary{{"sessions", Value(std::move(liveSessions))},
                          {"ended", Value(std::move(endedTotals))},
                          {"storebags", Value(Dictionary{{"counts", countsValue(storebags)}})}});
}

std::optional<DaemonStatus> DaemonStatus::fromValue(const Value& v, std::string* why) {
  try {
    const Dictionary& top = dictionaryAt(v, "status");
    DaemonStatus status;
    const Array& sessions = arrayAt(top, "sessions", "status");
    for (std::size_t i = 0; i < sessions.size(); ++i) {
      const std::string where = fmt::format("status.sessions[{}]", i);
      const Dictionary& s = dictionaryAt(sessions[i], where);
      SessionStatus session;
      session.sessionID = static_cast<std::uint32_t>(unsignedAt(s, "sessionID", where, UINT32_MAX));
      session.sessionIDString = nameAt(s, "sessionIDString", where);
      session.clientType = signedAt(s, "clientType", where);
      const Array& backends = arrayAt(s, "backends", where);
      for (std::size_t k = 0; k < backends.size(); ++k) {
        const std::string at = fmt::format("{}.backends[{}]", where, k);
        const Dictionary& b = dictionaryAt(backends[k], at);
        session.backends.push_back(BackendStatus{nameAt(b, "name", at), signedAt(b, "state", at), countsAt(b, at)});
      }
      status.sessions.push_back(std::move(session));
    }
    const Array& ended = arrayAt(top, "ended", "status");
    for (std::size_t i = 0; i < ended.size(); ++i) {
      const std::string where = fmt::format("status.ended[{}]", i);
      const Dictionary& e = dictionaryAt(ended[i], where);
      status.ended.push_back(EndedTotals{signedAt(e, "clientType", where), nameAt(e, "backend", where),
                                         unsignedAt(e, "sessions", where, kMaxWireCount),
                                         countsAt(e, where)});
    }
    if (const Value* storebags = top.find("storebags")) {
      status.storebags = countsAt(dictionaryAt(*storebags, "status.storebags"), "status.storebags");
    }
    return status;
  } catch (const Refused& refused) {
    if (why) {
      *why = refused.why;
    }
    return std::nullopt;
  }
}

}  // namespace zerith::ipc
