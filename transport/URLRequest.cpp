#include <strings.h>

#include <algorithm>
#include <memory>
#include <semaphore>

#include "platform/LockRank.h"
#include "platform/ThreadPools.h"
#include "transport/ReportingSessionConnectivityInterface.h"
#include "transport/URLSession.h"

namespace zerith {

namespace {

bool sameField(std::string_view a, std::string_view b) {
  return a.size() == b.size() && ::strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::optional<std::string> findField(const HTTPHeaders& headers, std::string_view field) {
  const auto it = std::find_if(headers.begin(), headers.end(), [&](const auto& h) { return sameField(h.first, field); });
  if (it == headers.end()) {
    return std::nullopt;
  }
  return it->second;
}

}  // namespace

void URLRequest::setValue(std::string value, std::string field) {
  const auto it = std::find_if(headers.begin(), headers.end(), [&](const auto& h) { return sameField(h.first, field); });
  if (it == headers.end()) {
    headers.emplace_back(std::move(field), std::move(value));
    return;
  }
  // The first occurrence keeps its place; any later duplicates go.
  it->second = std::move(value);
  const auto first = it - headers.begin();
  headers.erase(std::remove_if(headers.begin() + first + 1, headers.end(), [&](const auto& h) { return sameField(h.first, field); }),
                headers.end());
}

std::optional<std::string> URLRequest::valueForHTTPHeaderField(std::string_view field) const {
  return findField(headers, field);
}

std::optional<std::string> HTTPURLResponse::valueForHTTPHeaderField(std::string_view field) const {
  return findField(headers, field);
}

URLAnswer postURLRequestAndWait(ReportingSessionConnectivityInterface& transport, const URLRequest& request) {
  struct Waiter {
    std::binary_semaphore done{0};
    URLAnswer answer;
  };
  auto waiter = std::make_shared<Waiter>();
  const bool taken = transport.postURLRequestWithCompletionHandler(
      request, [waiter](const Data& data, const std::optional<HTTPURLResponse>& response,
                        const std::optional<Error>& error) {
        waiter->answer = URLAnswer{data, response, error};
        waiter->done.release();
      });
  if (!taken) {
    return URLAnswer{{}, std::nullopt, Error{kURLErrorDomain, kURLErrorCannotWriteBody, "the request's body could not be written"}};
  }
  lockrank::assertNoLockHeld("an HTTP answer");
  const PoolWait wait;
  waiter->done.acquire();
  return std::move(waiter->answer);
}

}  // namespace zerith
