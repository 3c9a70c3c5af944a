#include "ipc/SocketConnection.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <set>
#include <thread>

#include "ipc/tests/IpcTestSupport.h"
#include "platform/Executors.h"
#include "platform/Log.h"

namespace zerith::ipc::test {
namespace {

Data callFrame(const std::string& op, std::optional<std::uint64_t> call, Dictionary args = {}) {
  return encodeCall(op, call, args);
}

// ---- framing on the wire --------------------------------------------------------

// A binary property list {key: value} with both as 8-bit "ASCII" strings,
// written by hand because libplist's writer would repair the bytes.
Data oneEntryBinaryDictionary(const std::string& key, const std::string& value) {
  Data d{'b', 'p', 'l', 'i', 's', 't', '0', '0', 0xd1, 0x01, 0x02};
  const auto keyAt = static_cast<std::uint8_t>(d.size());
  d.push_back(static_cast<std::uint8_t>(0x50 | key.size()));
  d.insert(d.end(), key.begin(), key.end());
  const auto valueAt = static_cast<std::uint8_t>(d.size());
  d.push_back(static_cast<std::uint8_t>(0x50 | value.size()));
  d.insert(d.end(), value.begin(), value.end());
  const auto tableAt = static_cast<std::uint8_t>(d.size());
  // The offset table, then the trailer: offset and reference sizes, three
  // objects, the top one first, the table's place.
  d.insert(d.end(), {8, keyAt, valueAt, 0, 0, 0, 0, 0, 0, 1, 1, 0, 0, 0, 0, 0, 0, 0, 3});
  d.insert(d.end(), {0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, 0, tableAt});
  return d;
}

struct BadInput {
  const char* name;
  Data bytes;
  std::string why;          // empty: libplist's own reason
  bool endsInside = false;  // the peer ends its side after these bytes
};

Data framed(const Value& v) { return frameWithBody(plist::encodeBinary(v)); }

class SocketConnectionBadFrame : public ::testing::TestWithParam<BadInput> {};

TEST_P(SocketConnectionBadFrame, FramesBeforeItArriveInOrderNoneAfterAndThatConnectionClosesWithAnErrorLog) {
  const BadInput& input = GetParam();
  log::LogCapture capture;
  RawPeer peer;
  RawPeer bystander;
  peer.write(concat({callFrame("a", std::nullopt), callFrame("b", 1), input.bytes,
                     input.endsInside ? Data{} : callFrame("after", 2)}));
  if (input.endsInside) {
    peer.closeWrite();
  }
  EXPECT_TRUE(peer.seesEof()) << "the connection stayed open";
  ASSERT_TRUE(peer.invalidated.waitFor(1));
  const auto calls = peer.object->calls();
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(std::tie(calls[0].operation, calls[0].call, calls[1].operation, calls[1].call),
            std::make_tuple("a", std::nullopt, "b", 1u));
  const std::string line = peer.connection->description() + ": closing connection: " +
                           (input.why.empty() ? "frame body does not parse" : input.why);
  EXPECT_TRUE(input.why.empty() ? capture.contains(line) : capture.has(log::Level::Error, line)) << "expected: " << line;
  // Another connection goes on.
  bystander.write(callFrame("still-here", 1));
  EXPECT_EQ(bystander.nextReplyTo(), 1u);
  EXPECT_EQ(bystander.invalidated.count(), 0);
}

INSTANTIATE_TEST_SUITE_P(
    Inputs, SocketConnectionBadFrame,
    ::testing::Values(
        BadInput{"OversizedLength", Data{0x00, 0x40, 0x00, 0x01, 'b', 'p'},
                 "frame of 4194305 bytes exceeds the limit of 4194304"},
        BadInput{"ZeroLength", Data{0, 0, 0, 0}, "empty frame"},
        BadInput{"NotAPropertyList", frameWithBody(bytesOfText("hello, daemon")),
                 "frame body is not a binary property list"},
        BadInput{"XmlBody", frameWithBody(bytesOfText(plist::encodeXml(Value(Dictionary{{"op", "echo"}})))),
                 "frame body is not a binary property list"},
        BadInput{"ArrayMessage", framed(Value(Array{Value("op")})), "message is an array, not a dictionary"},
        BadInput{"StringOpMissing", framed(Value(Dictionary{{"call", 1}})), "message has neither \"op\" nor \"reply\""},
        BadInput{"NumericOp", framed(Value(Dictionary{{"op", 5}})), "message \"op\" is an integer, not a string"},
        BadInput{"StringMessage", framed(Value("just a string")), "message is a string, not a dictionary"},
        BadInput{"OpAndReply", framed(Value(Dictionary{{"op", "x"}, {"reply", 1}})), "message has both \"op\" and \"reply\""},
        BadInput{"NegativeCallNumber", framed(Value(Dictionary{{"op", "x"}, {"call", -1}})),
                 "message \"call\" is not an unsigned integer"},
        BadInput{"RealCallNumber", framed(Value(Dictionary{{"op", "x"}, {"call", 1.5}})),
                 "message \"call\" is not an unsigned integer"},
        BadInput{"ReplyNumberAsText", framed(Value(Dictionary{{"reply", "1"}})),
                 "message \"reply\" is not an unsigned integer"},
        BadInput{"ReplyErrorNotADictionary", framed(Value(Dictionary{{"reply", 1}, {"error", "bad"}})),
                 "reply \"error\" is a string, not a dictionary"},
        BadInput{"ArgsNotADictionary", framed(Value(Dictionary{{"op", "x"}, {"args", Array{}}})),
                 "message \"args\" is an array, not a dictionary"},
        BadInput{"ClaimsMoreDescriptorsThanAFrameCarries", encodeCall("upload", 1, {}, kMaxDescriptorsPerFrame + 1),
                 "message \"fds\" is not a count of at most " + std::to_string(kMaxDescriptorsPerFrame) +
                     " descriptors"},
        BadInput{"TruncatedBinaryList", frameWithBody(Data{'b', 'p', 'l', 'i', 's', 't', '0', '0', 0x08}), ""},
        // libplist would pass such text on cut short at the bad byte.
        BadInput{"OperationNotUtf8", frameWithBody(oneEntryBinaryDictionary("op", "se\xffSession:")),
                 "message holds text that is not valid UTF-8"},
        BadInput{"KeyNotUtf8OverlongForm", frameWithBody(oneEntryBinaryDictionary("o\xc0\xafp", "x")),
                 "message holds text that is not valid UTF-8"},
        [] {
          Data cut = callFrame("cut", 1);
          cut.resize(cut.size() - 3);
          const std::string why = "it ended inside a frame (" + std::to_string(cut.size()) + " bytes unread)";
          return BadInput{"PeerEndsInsideAFrame", cut, why, true};
        }()),
    [](const auto& info) { return std::string(info.param.name); });

// Without a LogCapture the bad-call log holds repeats from one user back;
// each of their connections still closes.
TEST(SocketConnectionFraming, BadFramesOfOneUserCloseEveryConnectionWhileTheLogHoldsRepeatsBack) {
  for (const Data& bad : {encodeCall("upload", 1, {}, kMaxDescriptorsPerFrame + 1), Data{0, 0, 0, 0}}) {
    RawPeer peer;
    peer.write(bad);
    EXPECT_TRUE(peer.seesEof());
    EXPECT_TRUE(peer.invalidated.waitFor(1));
    EXPECT_EQ(peer.object->received.count(), 0);
  }
}

TEST(SocketConnectionFraming, AReplyToAnUnknownCallAndACallWithoutAnExportedObjectAreLoggedAndTheConnectionGoesOn) {
  log::LogCapture capture;
  RawPeer peer;
  peer.write(concat({encodeReply(4242, Dictionary{}), callFrame("after", 1)}));
  EXPECT_EQ(peer.nextReplyTo(), 1u);
  EXPECT_TRUE(capture.has(log::Level::Error, peer.connection->description() + ": reply to unknown call 4242"));
  peer.connection->setExportedObject(nullptr);
  peer.write(callFrame("anything", 3));
  const auto reply = peer.readMessage();
  ASSERT_TRUE(reply);
  EXPECT_EQ(reply->replyError, (Error{kErrorDomain, -1, "No object is exported on this connection"}));
  EXPECT_TRUE(capture.has(log::Level::Error, peer.connection->description() + ": no object is exported for \"anything\""));
  EXPECT_EQ(peer.invalidated.count(), 0);
}

// ---- calls, replies and writers ---------------------------------------------------

TEST(SocketConnectionCalls, ManyThreadsWaitingOnSeveralConnectionsEachGetTheirOwnReply) {
  // Replies are taken on the socket threads while the callers wait, or on a
  // client end by the waiting callers themselves, each reading the others'
  // replies too; calls that never wait are answered on the socket thread,
  // the others on the pool, so replies of one connection come back from both.
  constexpr int kPairs = 4;
  constexpr int kThreads = 6;
  constexpr int kCalls = 150;
  std::vector<std::unique_ptr<ConnectedPair>> pairs;
  for (int p = 0; p < kPairs; ++p) {
    pairs.push_back(std::make_unique<ConnectedPair>(p % 2 == 0));
    pairs.back()->object->quick = [](const Message& m) { return m.args.get("n").intValue() % 3 != 0; };
    pairs.back()->serve();
  }
  std::atomic<int> matched{0};
  onThreads(kThreads, [&](int t) {
    for (int n = 0; n < kCalls; ++n) {
      const Dictionary args{{"caller", t}, {"n", n}};
      matched += pairs[static_cast<std::size_t>((t + n) % kPairs)]->a->callAndWait("work", args, kWait).args == args;
    }
  });
  EXPECT_EQ(matched, kThreads * kCalls);
}

TEST(SocketConnectionCalls, CallsEndWithTheConnectionOrAtTheirTimeOutAndLaterOnesFailAtOnce) {
  const Error invalidated{kErrorDomain, -1, "The connection was invalidated"};
  ConnectedPair pair;
  pair.object->answer = [](const Message&, std::shared_ptr<Reply>) {};  // never answers
  pair.serve();
  const auto late = pair.a->callAndWait("silence", Dictionary{}, 100ms);
  EXPECT_TRUE(late.timedOut);
  EXPECT_FALSE(late.args);

  // A call waited for and one with a completion, both pending when the
  // peer goes away.
  auto pending = callLater(*pair.a, "never-answered", Dictionary{});
  std::thread closer([&] {
    pair.object->received.waitFor(3);
    pair.b->invalidate();
  });
  const auto gone = pair.a->callAndWait("silence", Dictionary{}, kWait);
  closer.join();
  EXPECT_EQ(std::tie(gone.timedOut, gone.args, gone.error), std::make_tuple(false, std::nullopt, invalidated));
  const auto result = pending->get();
  EXPECT_EQ(std::tie(result.args, result.error), std::make_tuple(std::nullopt, invalidated));
  // A call made afterwards fails at once instead of waiting for ever.
  auto after = callLater(*pair.a, "after", Dictionary{});
  EXPECT_EQ(after->get().error, invalidated);
}

TEST(SocketConnectionCalls, FramesFromManyWritersNeverInterleave) {
  RawPeer peer;
  constexpr int kThreads = 6;
  constexpr int kFrames = 40;
  std::thread writers([&] {
    onThreads(kThreads, [&](int t) {
      for (int n = 0; n < kFrames; ++n) {
        // Sizes vary so that partial writes land mid-frame.
        peer.connection->send("note", Dictionary{{"t", t}, {"n", n}, {"pad", Value(Data(static_cast<std::size_t>(n * 997 % 20000), 1))}});
      }
    });
  });
  std::vector<int> next(kThreads, 0);
  for (int i = 0; i < kThreads * kFrames; ++i) {
    const auto message = peer.readMessage();
    ASSERT_TRUE(message) << "frame " << i << " missing or garbled";
    const auto t = message->call.args.get("t").intValue();
    ASSERT_TRUE(t >= 0 && t < kThreads) << t;
    EXPECT_EQ(message->call.args.get("n").intValue(), next[static_cast<std::size_t>(t)]++) << "writer " << t << " out of order";
  }
  writers.join();
}

TEST(SocketConnectionCalls, AnErrorReplyReachesTheCallerAsAnError) {
  ConnectedPair pair;
  pair.object->answer = [](const Message&, std::shared_ptr<Reply> r) {
    r->fail(Error{"test.domain", 12, "no such thing"});
    r->send(Dictionary{{"late", true}});  // a second answer is dropped
  };
  pair.serve();
  EXPECT_EQ(pair.a->callAndWait("x", Dictionary{}, kWait).error, (Error{"test.domain", 12, "no such thing"}));
  // The dropped second answer did not turn into a reply for the next call.
  pair.object->answer = [](const Message&, std::shared_ptr<Reply> r) { r->send(Dictionary{{"ok", true}}); };
  EXPECT_EQ(pair.a->callAndWait("y", Dictionary{}, kWait).args, (Dictionary{{"ok", true}}));
}

// A call the other end would refuse (too deep, too large) is not sent: it
// alone fails with the reason, and the connection goes on. The deepest call
// the reader takes is sent and answered, so both ends count nesting alike.
TEST(SocketConnectionCalls, ACallBeyondTheFrameLimitsFailsAloneAndTheConnectionGoesOn) {
  ConnectedPair pair;
  pair.serve();
  // The root is 1, "args" 2, its entry 3: 29 arrays put the leaf at 32.
  const auto nested = [](int arrays) {
    Value v("leaf");
    for (int i = 0; i < arrays; ++i) {
      v = Value(Array{v});
    }
    return Dictionary{{"v", v}};
  };
  const auto deepest = pair.a->callAndWait("x", nested(29), kWait);
  EXPECT_FALSE(deepest.error) << deepest.error->description;
  EXPECT_EQ(deepest.args, nested(29));
  EXPECT_EQ(pair.a->callAndWait("x", nested(30), kWait).error,
            (Error{kErrorDomain, -1, "The message was not sent: message nests deeper than 32 levels"}));
  // The objects: the root, "op", "call", "args" and "v" with their values,
  // and the array's elements; the reader takes 262144.
  const auto wide = [](std::size_t elements) { return Dictionary{{"v", Array(elements, Value(7))}}; };
  // The widest call is a frame of 2 MiB each way, far more than a socket
  // buffer holds: read in pieces, and its echo written through the outbox.
  const auto widest = pair.a->callAndWait("x", wide((1u << 18) - 9), kWait);
  EXPECT_TRUE(widest.args == wide((1u << 18) - 9)) << (widest.error ? widest.error->description : "not echoed whole");
  EXPECT_EQ(pair.a->callAndWait("x", wide((1u << 18) - 8), kWait).error,
            (Error{kErrorDomain, -1, "The message was not sent: message holds more than 262144 objects"}));
  const auto large = pair.a->callAndWait("x", Dictionary{{"v", std::string(kMaxFrameBytes, 'x')}}, kWait);
  ASSERT_TRUE(large.error);
  EXPECT_NE(large.error->description.find("exceeds the frame limit of 4194304"), std::string::npos);
  EXPECT_EQ(pair.a->callAndWait("y", Dictionary{{"ok", true}}, kWait).args, (Dictionary{{"ok", true}}));
  EXPECT_EQ(pair.object->calls().size(), 3u);  // the refused ones never arrived
}

// ---- ordering, queue and invalidation -------------------------------------------

// Holds the queues of peers[i..] (nested syncs need no pool thread) while
// `whileHeld` runs.
void holdQueues(std::vector<std::unique_ptr<RawPeer>>& peers, std::size_t i, const std::function<void()>& whileHeld) {
  if (i == peers.size()) {
    whileHeld();
    return;
  }
  peers[i]->connection->queue().sync([&] { holdQueues(peers, i + 1, whileHeld); });
}

std::vector<std::unique_ptr<RawPeer>> rawPeers(std::size_t n) {
  std::vector<std::unique_ptr<RawPeer>> peers;
  for (std::size_t i = 0; i < n; ++i) {
    peers.push_back(std::make_unique<RawPeer>());
  }
  return peers;
}

TEST(SocketConnectionDelivery, ReadsArrivingWhileManyQueuesAreBusyDoNotStarveThePool) {
  // More busy connections than the pool has threads: a reading thread that
  // waited for its busy queue would hold a pool thread, and enough of them
  // would leave none to run the queues' own work.
  auto peers = rawPeers(48);
  bool poolAlive = false;
  holdQueues(peers, 0, [&] {
    for (auto& p : peers) {
      p->write(callFrame("while-busy", std::nullopt));
    }
    std::this_thread::sleep_for(200ms);  // the reads complete meanwhile
    std::promise<void> ran;
    SerialQueue("probe").async([&] { ran.set_value(); });
    poolAlive = ran.get_future().wait_for(5s) == std::future_status::ready;
  });
  EXPECT_TRUE(poolAlive) << "no pool thread was free while the queues were busy";
  for (auto& p : peers) {
    EXPECT_TRUE(p->object->received.waitFor(1));
  }
}

// However the end comes, the handler runs once, on the queue, while the
// exported object is still there; the object goes right after, and the
// connection never reports an interruption.
TEST(SocketConnectionDelivery, InvalidationHandlerRunsExactlyOnceWhenEofAndInvalidateRaceThenReleasesTheObject) {
  for (int round = 0; round < 20; ++round) {
    std::atomic<bool> onQueue{true};
    std::atomic<bool> sawObject{false};
    Counter interrupted;
    RawPeer peer;
    const std::weak_ptr<RecordingObject> weak = std::exchange(peer.object, nullptr);
    peer.connection->setInterruptionHandler([&] { interrupted.hit(); });
    peer.connection->setInvalidationHandler([&] {
      onQueue = onQueue && peer.connection->queue().isCurrent();
      sawObject = !weak.expired();
      peer.invalidated.hit();
    });
    onThreads(5, [&](int i) {
      if (i == 0) {
        peer.raw.close();
      } else {
        peer.connection->invalidate();
      }
    });
    ASSERT_TRUE(peer.invalidated.waitFor(1));
    // Give a wrong second run every chance to show up.
    peer.connection->queue().sync([] {});
    EXPECT_EQ(peer.invalidated.count(), 1);
    EXPECT_TRUE(onQueue);
    EXPECT_TRUE(sawObject) << "the object was gone before the handler ran";
    EXPECT_TRUE(weak.expired()) << "the connection still holds its exported object";
    EXPECT_EQ(interrupted.count(), 0);
    peer.connection.reset();
  }
}

TEST(SocketConnectionDelivery, NothingIsDeliveredBeforeResume) {
  RawPeer peer(false);
  peer.write(callFrame("early", std::nullopt));
  EXPECT_FALSE(peer.object->received.waitFor(1, 100ms));
  peer.connection->resume();
  EXPECT_TRUE(peer.object->received.waitFor(1));
}

// ---- the socket threads ------------------------------------------------------------

TEST(SocketConnectionSocketThreads, ACallThatMayWaitLeavesTheSocketThreadsToTheOtherConnections) {
  // More connections than socket threads: some share the blocked one's.
  constexpr std::size_t kPeers = 9;
  auto peers = rawPeers(kPeers);
  std::promise<void> release;
  std::shared_future<void> released = release.get_future().share();
  Counter blocked;
  std::atomic<bool> blockedOnSocketThread{false};
  peers[0]->object->answer = [&](const Message&, std::shared_ptr<Reply> r) {
    blockedOnSocketThread = onSocketThread();
    blocked.hit();
    released.wait_for(kWait);
    r->send(Dictionary{{"late", true}});
  };
  std::atomic<int> quickOffSocketThread{0};
  for (std::size_t i = 1; i < kPeers; ++i) {
    peers[i]->object->quick = [](const Message&) { return true; };
    peers[i]->object->answer = [&](const Message& m, std::shared_ptr<Reply> r) {
      quickOffSocketThread += !onSocketThread();
      r->send(m.args);
    };
  }
  peers[0]->write(callFrame("upload", 1));
  ASSERT_TRUE(blocked.waitFor(1));
  for (std::size_t i = 1; i < kPeers; ++i) {
    peers[i]->write(callFrame("quick", 7, Dictionary{{"i", static_cast<std::int64_t>(i)}}));
  }
  for (std::size_t i = 1; i < kPeers; ++i) {
    const auto reply = peers[i]->readMessage();
    ASSERT_TRUE(reply) << "connection " << i << " got no answer while another one's call waited";
    EXPECT_EQ(std::tie(reply->replyTo, reply->replyArgs), std::make_tuple(7u, Dictionary{{"i", static_cast<std::int64_t>(i)}}));
  }
  release.set_value();
  EXPECT_EQ(peers[0]->nextReplyTo(), 1u);
  EXPECT_FALSE(blockedOnSocketThread) << "a call that may wait ran on a socket thread";
  EXPECT_EQ(quickOffSocketThread, 0) << "calls that never wait were handed to the pool although the queue was free";
}

// Many calls in one stream: whichever of them may wait, each is handled on
// the connection's queue one at a time and answered in order. Replies vary
// in size, some larger than a socket buffer takes at once; the stream is
// written from a thread of its own, so the connection stops reading while
// the test has not read the replies yet.
struct CallStream {
  const char* name;
  bool (*neverWaits)(std::int64_t n);
  bool slowSleeps;    // calls that may wait take a millisecond
  std::size_t chunk;  // bytes per write (0: all at once)
};

class SocketConnectionCallStream : public ::testing::TestWithParam<CallStream> {};

TEST_P(SocketConnectionCallStream, AllCallsAreHandledOneAtATimeOnTheQueueAndAnsweredInOrder) {
  const CallStream& stream = GetParam();
  RawPeer peer;
  std::atomic<int> inside{0};
  std::atomic<bool> overlapped{false};
  std::atomic<bool> offQueue{false};
  peer.object->quick = [&](const Message& m) { return stream.neverWaits(m.args.get("n").intValue()); };
  peer.object->answer = [&](const Message& m, std::shared_ptr<Reply> r) {
    overlapped = ++inside > 1 || overlapped;
    offQueue = !peer.connection->queue().isCurrent() || offQueue;
    if (stream.slowSleeps && !stream.neverWaits(m.args.get("n").intValue())) {
      std::this_thread::sleep_for(1ms);
    }
    --inside;
    r->send(m.args);
  };
  constexpr int kCalls = 400;
  const Data all = framesOf(kCalls, [](int n) {
    return callFrame("echo", static_cast<std::uint64_t>(n + 1),
                     Dictionary{{"n", n}, {"pad", Value(Data(static_cast<std::size_t>(n * 331 % 9000), 7))}});
  });
  std::thread writer([&] { peer.write(all, stream.chunk); });
  for (int n = 0; n < kCalls; ++n) {
    const auto reply = peer.readMessage();
    if (!reply || reply->replyTo != static_cast<std::uint64_t>(n + 1)) {
      peer.raw.close();  // the writer ends too
      writer.join();
      FAIL() << "reply " << n << " missing or out of order";
    }
    EXPECT_EQ(reply->replyArgs.get("n").intValue(), n);
  }
  writer.join();
  const auto calls = peer.object->calls();
  ASSERT_EQ(calls.size(), static_cast<std::size_t>(kCalls));
  for (std::size_t n = 0; n < calls.size(); ++n) {
    EXPECT_EQ(calls[n].args.get("n").intValue(), static_cast<std::int64_t>(n));
  }
  EXPECT_FALSE(overlapped);
  EXPECT_FALSE(offQueue);
}

INSTANTIATE_TEST_SUITE_P(
    WaitingOrNot, SocketConnectionCallStream,
    ::testing::Values(CallStream{"NoneWait", [](std::int64_t) { return true; }, false, 0},
                      CallStream{"AllMayWait", [](std::int64_t) { return false; }, false, 0},
                      CallStream{"EveryOtherMayWait", [](std::int64_t n) { return n % 2 == 0; }, false, 0},
                      CallStream{"EveryTenthWaitsInSmallWrites", [](std::int64_t n) { return n % 10 != 0; }, true, 1000}),
    [](const auto& info) { return std::string(info.param.name); });

// ---- writes gathered per chunk ------------------------------------------------------

// A frame another thread writes during a delivery keeps its place; a reply
// made later from another thread leaves at once while nothing else happens.
TEST(SocketConnectionGatheredWrites, FramesWrittenFromOtherThreadsKeepTheirPlaceAndLeaveAtOnce) {
  std::promise<std::shared_ptr<Reply>> kept;  // outlives the connection's handlers
  RawPeer peer;
  peer.object->quick = [](const Message&) { return true; };
  peer.object->answer = [&](const Message& m, std::shared_ptr<Reply> r) {
    if (m.operation == "a") {
      // Written, and done, before the reply below is made.
      std::thread([&] { peer.connection->send("aside", Dictionary{}); }).join();
    } else if (m.operation == "later") {
      kept.set_value(std::move(r));
      return;
    }
    r->send(m.args);
  };
  peer.write(concat({callFrame("a", 1), callFrame("later", 2), callFrame("b", 3)}));
  const auto first = peer.readMessage();
  ASSERT_TRUE(first);
  EXPECT_EQ(std::tie(first->kind, first->call.operation), std::make_tuple(IncomingMessage::Kind::Call, "aside"));
  EXPECT_EQ(peer.nextReplyTo(), 1u);
  EXPECT_EQ(peer.nextReplyTo(), 3u);
  auto future = kept.get_future();
  ASSERT_EQ(future.wait_for(kWait), std::future_status::ready);
  std::thread([reply = future.get()] { reply->send(Dictionary{{"late", true}}); }).join();
  const auto late = peer.readMessage();
  ASSERT_TRUE(late) << "a reply written outside any delivery stayed in the outbox";
  EXPECT_EQ(std::tie(late->replyTo, late->replyArgs), std::make_tuple(2u, Dictionary{{"late", true}}));
}

TEST(SocketConnectionGatheredWrites, AHandlerThatMayWaitHoldsNoFrameBack) {
  // slow, quick, slow in one chunk: the first slow call is handed to the
  // pool from the socket thread, the second is met on the pool itself. Each
  // writes a frame and waits until the test has read it; gathered frames
  // would never arrive.
  std::promise<void> seen[2];  // outlives the connection's handlers
  RawPeer peer;
  peer.object->quick = [](const Message& m) { return m.operation == "quick"; };
  peer.object->answer = [&](const Message& m, std::shared_ptr<Reply> r) {
    if (m.operation == "slow") {
      const auto n = m.args.get("n").intValue();
      peer.connection->send("progress", Dictionary{{"n", n}});
      if (seen[n].get_future().wait_for(kWait) != std::future_status::ready) {
        ADD_FAILURE() << "progress frame " << n << " was not read";
      }
    }
    r->send(m.args);
  };
  peer.write(concat({callFrame("slow", 1, Dictionary{{"n", 0}}), callFrame("quick", 2),
                     callFrame("slow", 3, Dictionary{{"n", 1}})}));
  // On the wire: progress 0, reply 1, reply 2, progress 1, reply 3.
  const std::vector<std::uint64_t> repliesAfter[2] = {{1, 2}, {3}};
  for (int n = 0; n < 2; ++n) {
    const auto progress = peer.readMessage();
    ASSERT_TRUE(progress) << "progress " << n << " held back while its handler waits";
    EXPECT_EQ(std::tie(progress->call.operation, progress->call.args), std::make_tuple("progress", Dictionary{{"n", n}}));
    seen[n].set_value();
    for (const std::uint64_t call : repliesAfter[n]) {
      EXPECT_EQ(peer.nextReplyTo(), call) << "reply to call " << call << " missing";
    }
  }
}

// ---- identity ---------------------------------------------------------------------

TEST(SocketConnectionIdentity, PeerCredentialsComeFromTheSocketAndTheDescriptionNamesThem) {
  RawPeer raw;
  const auto& p = raw.connection->peer();
  EXPECT_EQ(std::make_tuple(p.pid, p.uid, p.gid), std::make_tuple(::getpid(), ::getuid(), ::getgid()));
  std::vector<gid_t> groups(static_cast<std::size_t>(::getgroups(0, nullptr)));
  groups.resize(static_cast<std::size_t>(::getgroups(static_cast<int>(groups.size()), groups.data())));
  EXPECT_EQ(std::multiset<gid_t>(p.groups.begin(), p.groups.end()), std::multiset<gid_t>(groups.begin(), groups.end()));
  const std::string text = raw.connection->description();
  EXPECT_EQ(text.rfind("<connection pid=" + std::to_string(p.pid) + " uid=" + std::to_string(p.uid) + " fd=", 0), 0u)
      << text;
  EXPECT_EQ(text.back(), '>');
}

}  // namespace
}  // namespace zerith::ipc::test
