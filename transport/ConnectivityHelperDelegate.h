#pragma once

// What a connectivity helper needs of its owner: to be told once the helper's
// HTTP session has become invalid, so that the owner can let go of the
// keep-alive count the helper held. The agent implements it (as part of
// ZerithdSessionDelegate); the one-shot helper has none.

namespace zerith {

class ConnectivityHelperDelegate {
 public:
  virtual ~ConnectivityHelperDelegate() = default;
  virtual void releaseVeskTransaction() = 0;
};

}  // namespace zerith
