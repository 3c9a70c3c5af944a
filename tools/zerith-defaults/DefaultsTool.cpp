#include "tools/zerith-defaults/DefaultsTool.h"

#include <algorithm>
#include <cctype>
#include <charconv>
#include <cmath>
#include <filesystem>
#include <ostream>
#include <system_error>

#include <fmt/format.h>

#include "config/MessageLog.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/PropertyList.h"

namespace zerith::tool {

namespace {

std::string lowercased(std::string s) {
  std::transform(s.begin(), s.end(), s.begin(),
                 [](char c) { return static_cast<char>(std::tolower(static_cast<unsigned char>(c))); });
  return s;
}

// A typed value from the command line; nullopt with a message in `why`.
std::optional<Value> parseTyped(const std::string& type, const std::string& text, std::string* why) {
  if (type == "-string") {
    return Value(text);
  }
  if (type == "-int" || type == "-integer") {
    long long v = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v);
    if (ec != std::errc() || end != text.data() + text.size() || text.empty()) {
      *why = fmt::format("'{}' is not an integer", text);
      return std::nullopt;
    }
    return Value(v);
  }
  if (type == "-bool" || type == "-boolean") {
    const std::string t = lowercased(text);
    if (t == "true" || t == "yes" || t == "1") {
      return Value(true);
    }
    if (t == "false" || t == "no" || t == "0") {
      return Value(false);
    }
    *why = fmt::format("'{}' is not a boolean (true, false, yes, no, 1, 0)", text);
    return std::nullopt;
  }
  if (type == "-real" || type == "-float") {
    double v = 0;
    const auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), v);
    if (ec != std::errc() || end != text.data() + text.size() || text.empty() || !std::isfinite(v)) {
      *why = fmt::format("'{}' is not a finite real number", text);
      return std::nullopt;
    }
    return Value(v);
  }
  *why = fmt::format("unknown type {}", type);
  return std::nullopt;
}

std::string plainText(const Value& v) {
  if (auto text = v.scalarText()) {
    return *text;
  }
  switch (v.type()) {
    case Value::Type::Date:
      return dateDescription(v.date()->secondsSince1970);
    default:
      return plist::encodeXml(v);
  }
}

int read(const std::vector<std::string>& w, std::ostream& out, std::ostream& err) {
  const Defaults domain(w[1]);
  if (!std::filesystem::exists(domain.path())) {
    err << fmt::format("zerith-defaults: domain {} does not exist\n", w[1]);
    return kNotFound;
  }
  if (w.size() == 2) {
    out << plist::encodeXml(domain.dictionary());
    return kOk;
  }
  const Value v = domain.objectForKey(w[2]);
  if (v.isNil()) {
    err << fmt::format("zerith-defaults: domain {} has no key {}\n", w[1], w[2]);
    return kNotFound;
  }
  const std::string text = plainText(v);
  out << text;
  if (text.empty() || text.back() != '\n') {
    out << '\n';
  }
  return kOk;
}

int write(const std::vector<std::string>& w, std::ostream& err) {
  std::optional<Value> value;
  std::string why;
  if (w.size() == 4) {
    value = Value(w[3]);
  } else {
    value = parseTyped(w[3], w[4], &why);
  }
  if (!value) {
    err << "zerith-defaults: " << why << "\n";
    return kUsage;
  }
  if (!Defaults(w[1]).setObject(w[2], *value)) {
    err << fmt::format("zerith-defaults: could not write {}\n", Defaults(w[1]).path().string());
    return kNotFound;
  }
  // Written all the same: the operator may know better (a newer daemon).
  auto unread = unreadDefaultsDomain(w[1]);
  if (!unread) {
    unread = unreadDefaultsKey(w[1], w[2]);
  }
  if (unread) {
    err << "zerith-defaults: warning: " << *unread << "\n";
  }
  for (const std::string& problem : defaultsDomainProblems(w[1])) {
    if (problem.starts_with("\"" + w[2] + "\" ")) {
      err << "zerith-defaults: warning: " << problem << "\n";
    }
  }
  return kOk;
}

// Every problem of the named domains' files (every domain the daemon reads
// when none is named): status 1 when there is one.
int check(const std::vector<std::string>& w, std::ostream& out, std::ostream& err) {
  std::vector<std::string> domains(w.begin() + 1, w.end());
  if (domains.empty()) {
    for (const DefaultsSetting& s : kDefaultsSettings) {
      if (std::find(domains.begin(), domains.end(), s.domain) == domains.end()) {
        domains.emplace_back(s.domain);
      }
    }
  }
  std::size_t problems = 0;
  for (const std::string& domain : domains) {
    if (const auto unread = unreadDefaultsDomain(domain);
        unread && std::filesystem::exists(Defaults(domain).path())) {
      err << "zerith-defaults: " << *unread << "\n";
      ++problems;
      continue;
    }
    for (const std::string& problem : defaultsDomainProblems(domain)) {
      err << "zerith-defaults: " << problem << "\n";
      ++problems;
    }
  }
  out << (problems == 0 ? std::string("no problems\n")
                        : fmt::format("{} problem{}\n", problems, problems == 1 ? "" : "s"));
  return problems == 0 ? kOk : kNotFound;
}

int remove(const std::vector<std::string>& w, std::ostream& err) {
  const Defaults domain(w[1]);
  if (!std::filesystem::exists(domain.path())) {
    err << fmt::format("zerith-defaults: domain {} does not exist\n", w[1]);
    return kNotFound;
  }
  if (w.size() == 2) {
    std::error_code ec;
    if (!std::filesystem::remove(domain.path(), ec) || ec) {
      err << fmt::format("zerith-defaults: could not delete {}: {}\n", domain.path().string(), ec.message());
      return kNotFound;
    }
    return kOk;
  }
  if (domain.objectForKey(w[2]).isNil()) {
    err << fmt::format("zerith-defaults: domain {} has no key {}\n", w[1], w[2]);
    return kNotFound;
  }
  if (!domain.removeObject(w[2])) {
    err << fmt::format("zerith-defaults: could not write {}\n", domain.path().string());
    return kNotFound;
  }
  return kOk;
}

}  // namespace

std::string usage() {
  return "usage: zerith-defaults [--root DIR] read DOMAIN [KEY]\n"
         "       zerith-defaults [--root DIR] write DOMAIN KEY [-string|-int|-bool|-real] VALUE\n"
         "       zerith-defaults [--root DIR] delete DOMAIN [KEY]\n"
         "       zerith-defaults [--root DIR] check [DOMAIN...]\n";
}

int runDefaultsCommand(const std::vector<std::string>& words, std::ostream& out, std::ostream& err) {
  const std::size_t n = words.size();
  const std::string command = n > 0 ? words[0] : std::string();
  // A domain names a file in the defaults folder, never a path. check takes
  // several.
  const std::size_t domainsEnd = command == "check" ? n : std::min<std::size_t>(n, 2);
  for (std::size_t i = 1; i < domainsEnd; ++i) {
    if (words[i].empty() || words[i].find('/') != std::string::npos || words[i][0] == '.') {
      err << fmt::format("zerith-defaults: '{}' is not a domain name\n", words[i]);
      return kUsage;
    }
  }
  if (command == "read" && (n == 2 || n == 3)) {
    return read(words, out, err);
  }
  if (command == "write" && (n == 4 || n == 5)) {
    return write(words, err);
  }
  if (command == "delete" && (n == 2 || n == 3)) {
    return remove(words, err);
  }
  if (command == "check") {
    return check(words, out, err);
  }
  err << usage();
  return kUsage;
}

}  // namespace zerith::tool
