#pragma once

// What users of the HTTP transport see: a request, the response, and the two
// operations of a connectivity helper. The completion runs exactly once per
// accepted request, on the helper's state queue, with the bytes received (an
// empty buffer, never absent, when the answer had no body), the response
// (absent when none arrived) and the error (absent on success). HTTP status
// codes are not interpreted by the transport.

#include <cstddef>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/Error.h"
#include "platform/Value.h"

namespace zerith {

using HTTPHeaders = std::vector<std::pair<std::string, std::string>>;

// What a server may answer to a request unless the request says otherwise:
// a collector's answer to a post or an upload is a few bytes.
inline constexpr std::size_t kDefaultMaxResponseBytes = 1u << 20;

struct URLRequest {
  std::string httpMethod = "GET";
  std::string url;
  HTTPHeaders headers;
  Data body;
  double timeoutSeconds = 0;     // 0: no limit of the request's own
  bool ignoreLocalCache = false;  // never answer from a local cache
  bool allowsCellularAccess = true;
  // The response body is cut while it arrives once it would pass this many
  // bytes (or at once when its Content-Length says it will): the request
  // then fails with kURLErrorResponseTooLarge.
  std::size_t maxResponseBytes = kDefaultMaxResponseBytes;
  // A mode-1 POST whose body file cannot be written completes with
  // kURLErrorCannotWriteBody instead of being dropped without a completion.
  bool completesWhenBodyFails = false;

  void setValue(std::string value, std::string field);  // replaces a header (case-insensitive name)
  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;
};

struct HTTPURLResponse {
  long statusCode = 0;
  std::string url;
  HTTPHeaders headers;
  std::optional<std::string> valueForHTTPHeaderField(std::string_view field) const;  // case-insensitive
};

using URLCompletion =
    std::function<void(const Data& data, const std::optional<HTTPURLResponse>& response, const std::optional<Error>& error)>;

class ReportingSessionConnectivityInterface {
 public:
  virtual ~ReportingSessionConnectivityInterface() = default;
  // False when the request was not taken (its body file could not be
  // written, or the helper does not post): the completion never runs.
  virtual bool postURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) = 0;
  virtual void getURLRequestWithCompletionHandler(const URLRequest& request, URLCompletion completion) = 0;
};

// What a POST that its caller waited for was answered.
struct URLAnswer {
  Data data;
  std::optional<HTTPURLResponse> response;
  std::optional<Error> error;
};

// Posts `request` and blocks the calling thread until its completion has run,
// without a time limit of its own (uploads wait for their answer). A request
// the transport did not take is answered at once with an error. Completions
// run on the helper's state queue, so never call this from one.
URLAnswer postURLRequestAndWait(ReportingSessionConnectivityInterface& transport, const URLRequest& request);

}  // namespace zerith
