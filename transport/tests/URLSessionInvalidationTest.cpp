// An invalidation that comes between a task's creation and its start (as
// when a session ends while its last batch is handed to the transport)
// waits for that task: its completion still reaches the delegate, and the
// invalidation comes after it.

#include <gtest/gtest.h>

#include "transport/URLSession.h"
#include "transport/tests/TransportTestSupport.h"

namespace zerith::test {
namespace {

class Recording : public URLSessionDelegate {
 public:
  explicit Recording(std::shared_ptr<EventLog> log) : log_(std::move(log)) {}
  void didBecomeInvalidWithError(URLSession&, const std::optional<Error>&) override { log_->add("invalid"); }
  void didCompleteWithError(URLSession&, URLSessionTask&, const std::optional<Error>&) override { log_->add("complete"); }

 private:
  std::shared_ptr<EventLog> log_;
};

using URLSessionInvalidationTest = TransportTest;

TEST_F(URLSessionInvalidationTest, ATaskMadeBeforeTheInvalidationCompletesFirst) {
  server.on("/post", Reply{.status = 204});
  auto events = std::make_shared<EventLog>();
  auto delegate = std::make_shared<Recording>(events);
  auto session = URLSession::sessionWithConfiguration(URLSessionConfiguration::defaultSessionConfiguration(), delegate,
                                                      mainOperationQueue());
  auto started = session->dataTaskWithRequest(post(server.url("/post"), "late"));
  auto dropped = session->dataTaskWithRequest(post(server.url("/post"), "never"));
  ASSERT_TRUE(started && dropped);
  session->finishTasksAndInvalidate();
  started->resume();
  dropped.reset();  // never started: it holds the invalidation no longer
  ASSERT_TRUE(events->waitFor("invalid"));
  EXPECT_EQ(events->events(), (std::vector<std::string>{"complete", "invalid"}));
  EXPECT_EQ(server.requestCount(), 1u);
}

}  // namespace
}  // namespace zerith::test
