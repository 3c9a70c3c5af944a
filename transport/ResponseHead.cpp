#include "transport/ResponseHead.h"

#include <string>

namespace zerith {

namespace {

bool isBlank(char c) { return c == ' ' || c == '\t'; }
bool isLineEnd(char c) { return c == '\r' || c == '\n'; }

std::string_view trim(std::string_view s) {
  while (!s.empty() && (isBlank(s.front()) || isLineEnd(s.front()))) {
    s.remove_prefix(1);
  }
  while (!s.empty() && (isBlank(s.back()) || isLineEnd(s.back()))) {
    s.remove_suffix(1);
  }
  return s;
}

// Bare CR or LF inside a line (never sent by a sane server) become spaces so
// that no caller ever sees a line break inside a value.
std::string withoutLineBreaks(std::string_view s) {
  std::string out(s);
  for (char& c : out) {
    if (isLineEnd(c) || c == '\0') {
      c = ' ';
    }
  }
  return out;
}

}  // namespace

ResponseHeadLine parseResponseHeadLine(std::string_view line, HTTPHeaders& fields) {
  while (!line.empty() && isLineEnd(line.back())) {
    line.remove_suffix(1);
  }
  if (line.empty()) {
    return ResponseHeadLine::End;
  }
  if (line.substr(0, 5) == "HTTP/") {
    fields.clear();
    return ResponseHeadLine::StatusLine;
  }
  if (isBlank(line.front())) {
    // An obsolete folded continuation of the previous field.
    if (fields.empty()) {
      return ResponseHeadLine::Ignored;
    }
    const std::string_view more = trim(line);
    if (!more.empty()) {
      auto& value = fields.back().second;
      value += value.empty() ? "" : " ";
      value += withoutLineBreaks(more);
    }
    return ResponseHeadLine::Field;
  }
  const auto colon = line.find(':');
  if (colon == std::string_view::npos || colon == 0) {
    return ResponseHeadLine::Ignored;
  }
  const std::string_view name = line.substr(0, colon);
  for (char c : name) {
    if (isBlank(c) || isLineEnd(c) || c == '\0') {
      return ResponseHeadLine::Ignored;
    }
  }
  fields.emplace_back(std::string(name), withoutLineBreaks(trim(line.substr(colon + 1))));
  return ResponseHeadLine::Field;
}

}  // namespace zerith
