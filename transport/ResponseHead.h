#pragma once

// The head of an HTTP response as libcurl hands it over: one line per call
// (status line, header fields, the empty line), for every response of a
// transfer (interim 1xx answers and followed redirects included).

#include <string_view>

#include "transport/ReportingSessionConnectivityInterface.h"

namespace zerith {

enum class ResponseHeadLine {
  StatusLine,  // "HTTP/..." starts a new response: `fields` was cleared
  Field,       // a field was added (or a folded line joined to the last one)
  End,         // the empty line closing the head
  Ignored,     // not a header field (no name, no colon, a space before it)
};

// Adds the field of `line` to `fields`. Names keep their case; values lose
// surrounding blanks and the line end; line breaks never reach `fields`.
ResponseHeadLine parseResponseHeadLine(std::string_view line, HTTPHeaders& fields);

}  // namespace zerith
