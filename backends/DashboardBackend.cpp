#include "backends/DashboardBackend.h"
#include "backends/BackendsLog.h"

#include <arpa/inet.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <new>

#include <asio/posix/stream_descriptor.hpp>
#include <fmt/format.h>

#include "backends/DashboardDatagram.h"
#include "config/Conversions.h"
#include "platform/Executors.h"
#include "platform/Log.h"
#include "platform/PropertyList.h"

namespace zerith {

struct DashboardBackend::ReadSource {
  explicit ReadSource(int fd) : descriptor(ioContext(Pool::General), fd) {}
  asio::posix::stream_descriptor descriptor;
};

DashboardBackend::DashboardBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily,
                                   int socket)
    : ZerithBackend(std::move(name), std::move(profile), std::move(productFamily)),
      socketDescriptor_(socket),
      networkProcQueue_(kNetworkProcQueueLabel) {}

DashboardBackend::~DashboardBackend() {
  // Reached only once the timer and the read source have let go (or were
  // never made): nothing else runs on the network queue for this backend.
  // Datagrams still queued (unsent, or never acknowledged) go with it.
  counters().add(BackendCount::droppedTransportError, messageQueue_.size());
  if (readSource_) {
    std::error_code ignored;
    readSource_->descriptor.close(ignored);
    readSource_.reset();
    socketDescriptor_ = -1;
  }
  closeSocket();
}

std::shared_ptr<DashboardBackend> DashboardBackend::self() {
  return std::static_pointer_cast<DashboardBackend>(shared_from_this());
}

// --- Creation -----------------------------------------------------------------------

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(std::string name, Value profile,
                                                                 std::optional<std::string> productFamily) {
  const Value ip = profile["ip"];
  const Value port = profile["port"];
  std::optional<std::string> serverIP;
  if (ip.string()) {
    serverIP = *ip.string();
  }
  return initWithName(std::move(name), std::move(profile), std::move(serverIP),
                      static_cast<std::uint16_t>(port.isNil() ? 0 : port.intValue()), std::move(productFamily));
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(std::string name, std::optional<std::string> serverIP,
                                                                 std::uint16_t serverPort,
                                                                 std::optional<std::string> productFamily) {
  if (!serverIP) {
    return nullptr;
  }
  return initWithName(std::move(name), Value(), std::move(serverIP), serverPort, std::move(productFamily));
}

std::shared_ptr<DashboardBackend> DashboardBackend::initWithName(std::string name, Value profile,
                                                                 std::optional<std::string> serverIP,
                                                                 std::uint16_t serverPort,
                                                                 std::optional<std::string> productFamily) {
  const Value profileIP = profile["ip"];
  const Value profilePort = profile["port"];
  if (!profile.isNil()) {
    // An "ip" that is not text cannot be resolved either.
    if (!profileIP.string()) {
      backendsLogger().error("DashboardBackend(initWithName): can't resolve server IP");
      return nullptr;
    }
    if (profilePort.isNil()) {
      backendsLogger().error("DashboardBackend(initWithName): can't resolve server port");
      return nullptr;
    }
  }

  const int fd = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, IPPROTO_UDP);
  if (fd < 0) {
    backendsLogger().error("DashboardBackend(initWithName): socket() failed ({})", errno);
    return nullptr;
  }
  // From here the backend owns the socket: its destructor closes it.
  auto backend = std::make_shared<DashboardBackend>(Token{}, std::move(name), profile, std::move(productFamily), fd);
#ifdef SO_NOSIGPIPE
  const int one = 1;
  ::setsockopt(fd, SOL_SOCKET, SO_NOSIGPIPE, &one, sizeof one);
#endif
  // Linux has no SO_NOSIGPIPE; sendWhole passes MSG_NOSIGNAL instead.

  std::string address;
  std::uint16_t port = 0;
  if (!profile.isNil()) {
    backend->usingProfile_ = true;
    if (const Value display = profile["display_url"]; display.string()) {
      backend->setDisplayURL(*display.string());
    }
    if (const Value post = profile["post_url"]; post.string()) {
      backend->postURL_ = *post.string();
    }
    address = *profileIP.string();
    port = static_cast<std::uint16_t>(profilePort.intValue());
    if (const Value reliable = profile["reliable"]; !reliable.isNil()) {
      backend->useReliableUDP();
      // A period below one millisecond would spin: the default stays.
      if (const std::int64_t ms = reliable.intValue(); ms > 0) {
        backend->period_ = std::chrono::milliseconds(ms);
      }
    }
  } else {
    if (!serverIP) {
      backendsLogger().error("DashboardBackend(initWithName): initWitName with all null params.");
      return nullptr;
    }
    address = *serverIP;
    port = serverPort;
    backend->useReliableUDP();
  }

  makeIPv4SocketAddress(address, port, &backend->serverAddress_);
  if (backend->serverAddress_.sin_addr.s_addr == INADDR_NONE) {
    // inet_addr's "no address" is also 255.255.255.255, which is no
    // dashboard either.
    backendsLogger().error("DashboardBackend(initWithName): can't parse server IP {}", address);
    return nullptr;
  }
  if (::connect(fd, reinterpret_cast<const sockaddr*>(&backend->serverAddress_), sizeof backend->serverAddress_) != 0) {
    backendsLogger().error("DashboardBackend(initWithName): socket connect() failed.");
    return nullptr;
  }

  backend->nextTick_ = std::chrono::steady_clock::now();
  backend->networkProcQueue_.async([backend] {
    if (backend->reliableUDP_) {
      backend->armReadSource();
    }
    backend->scheduleTick();
  });
  return backend;
}

void DashboardBackend::useReliableUDP() {
  sockaddr_in any{};
  any.sin_family = AF_INET;
  any.sin_addr.s_addr = htonl(INADDR_ANY);
  any.sin_port = 0;
  if (::bind(socketDescriptor_, reinterpret_cast<const sockaddr*>(&any), sizeof any) != 0) {
    backendsLogger().error("DashboardBackend(useReliableUDP): can't bind socket, {}", errno);
    return;
  }
  sockaddr_in bound{};
  socklen_t length = sizeof bound;
  if (::getsockname(socketDescriptor_, reinterpret_cast<sockaddr*>(&bound), &length) == 0) {
    boundPort_ = ntohs(bound.sin_port);
  }
  reliableUDP_ = true;
  try {
    readSource_ = std::make_unique<ReadSource>(socketDescriptor_);
  } catch (const std::exception&) {
    backendsLogger().error("DashboardBackend(useReliableUDP): can't create read source");
    readSource_.reset();
  }
}

// --- Sending ------------------------------------------------------------------------

std::string DashboardBackend::descriptionForObject(const Value& object) {
  switch (object.type()) {
    case Value::Type::String:
      return *object.string();
    case Value::Type::Bool:
      return object.boolValue() ? "1" : "0";
    case Value::Type::Int:
      return std::to_string(object.intValue());
    case Value::Type::UInt:
      return std::to_string(object.unsignedValue());
    case Value::Type::Real:
      return fmt::format("{}", object.doubleValue());
    default:
      return "null";
  }
}

std::string DashboardBackend::sanitize(std::string_view text) { return dashboard::sanitize(text); }

std::string DashboardBackend::writeLocalLog(std::span<const std::uint8_t> datagram) {
  return dashboard::localLogLine(datagram).value_or(std::string());
}

std::optional<std::string> DashboardBackend::sendMessage(const Value& message, const timeval& timestamp,
                                                         std::uint16_t method, std::uint16_t respCode,
                                                         std::uint16_t eventID) {
  std::vector<std::pair<std::string, std::string>> items;
  std::vector<std::uint8_t> datagram;
  try {
    if (const Dictionary* dict = message.dict()) {
      items.reserve(dict->size());
      for (const auto& [key, value] : *dict) {
        items.emplace_back(key, descriptionForObject(value));
      }
      // Shortest value first; equal lengths keep the dictionary's order.
      std::stable_sort(items.begin(), items.end(),
                       [](const auto& a, const auto& b) { return a.second.size() < b.second.size(); });
      for (auto& item : items) {
        item.second = sanitize(item.second);
      }
    }
    dashboard::Header header;
    header.selfVersionMajor = selfVersionMajor();
    header.senderIndex = static_cast<std::uint8_t>(compType());
    header.seconds = static_cast<std::uint32_t>(timestamp.tv_sec);
    header.microseconds = static_cast<std::uint32_t>(timestamp.tv_usec);
    header.sessionID = sessionID();
    header.clientVersion = clientVersion();
    header.method = method;
    header.respCode = respCode;
    header.udid = udid();
    header.eventNumber = eventID;
    header.flags = static_cast<std::uint16_t>((reliableUDP_ ? dashboard::kFlagReliable : 0) |
                                              (usingProfile_ ? 0 : dashboard::kFlagNotFromProfile));
    datagram = dashboard::encode(header, dashboard::buildText(items));
  } catch (const std::bad_alloc&) {
    backendsLogger().error("DashboardBackend(sendMessage): can't malloc.");
    return std::nullopt;
  }
  std::string line = writeLocalLog(datagram);
  counters().add(BackendCount::sent);
  networkProcQueue_.async([self = self(), datagram = std::move(datagram), eventID] {
    self->tryToSendMsg(datagram, eventID);
  });
  return line;
}

bool DashboardBackend::sendWhole(std::span<const std::uint8_t> bytes) {
  if (socketDescriptor_ < 0) {
    return false;
  }
  const ssize_t sent = ::send(socketDescriptor_, bytes.data(), bytes.size(), MSG_NOSIGNAL);
  return sent >= 0 && static_cast<std::size_t>(sent) == bytes.size();
}

void DashboardBackend::tryToSendMsg(std::span<const std::uint8_t> bytes, std::uint16_t eventNumber) {
  networkProcQueue_.assertCurrent();
  const bool whole = sendWhole(bytes);
  if (whole && !reliableUDP_) {
    return;
  }
  UDPPacketToSend packet(bytes, eventNumber);
  if (whole) {
    packet.setState(UDPPacketToSend::kAwaitingAcknowledgement);
  }
  messageQueue_.push_back(std::move(packet));
  if (messageQueue_.size() > kMaxQueuedPackets) {
    messageQueue_.pop_front();
    counters().add(BackendCount::droppedQueueFull);
  }
  notifyObserver();
}

// --- Acknowledgements ---------------------------------------------------------------

void DashboardBackend::armReadSource() {
  if (!readSource_) {
    return;
  }
  readSource_->descriptor.async_wait(asio::posix::descriptor_base::wait_read,
                                     [self = self()](const std::error_code& ec) {
                                       if (ec) {
                                         return;  // cancelled: the sources are gone
                                       }
                                       self->networkProcQueue_.async([self] {
                                         if (self->sourcesCancelled_) {
                                           return;
                                         }
                                         self->processSocketRead();
                                         self->armReadSource();
                                       });
                                     });
}

void DashboardBackend::processSocketRead() {
  networkProcQueue_.assertCurrent();
  // Every datagram waiting now, a bounded number per wake-up.
  for (int round = 0; round < 64 && socketDescriptor_ >= 0; ++round) {
    std::array<std::uint8_t, dashboard::kMaxDatagram> buffer;
    sockaddr_in from{};
    socklen_t fromLength = sizeof from;
    // MSG_TRUNC: the datagram's real length, so that a long one is noticed.
    const ssize_t n = ::recvfrom(socketDescriptor_, buffer.data(), buffer.size(), MSG_DONTWAIT | MSG_TRUNC,
                                 reinterpret_cast<sockaddr*>(&from), &fromLength);
    if (n < 1) {
      return;
    }
    const bool truncated = static_cast<std::size_t>(n) > buffer.size();
    const std::size_t length = std::min<std::size_t>(static_cast<std::size_t>(n), buffer.size());
    if (fromLength < sizeof from || from.sin_family != AF_INET ||
        from.sin_addr.s_addr != serverAddress_.sin_addr.s_addr || from.sin_port != serverAddress_.sin_port) {
      backendsLogger().debug("DashboardBackend(processSocketRead): ignoring a datagram that did not come from the server");
      continue;
    }
    const auto event = dashboard::acknowledgedEventNumber(std::span(buffer.data(), length), truncated);
    if (!event) {
      backendsLogger().debug("DashboardBackend(processSocketRead): ignoring an acknowledgement of {} bytes", n);
      continue;
    }
    const auto match = std::find_if(messageQueue_.begin(), messageQueue_.end(),
                                    [&](const UDPPacketToSend& p) { return p.eventNumber() == *event; });
    if (match == messageQueue_.end()) {
      backendsLogger().debug("DashboardBackend(processSocketRead): no queued datagram for event {}", *event);
      continue;
    }
    messageQueue_.erase(match);
    counters().add(BackendCount::delivered);
    notifyObserver();
  }
}

// --- Timer ----------------------------------------------------------------------------

void DashboardBackend::scheduleTick() {
  networkProcQueue_.assertCurrent();
  if (sourcesCancelled_) {
    return;
  }
  // Fixed rate: each tick is due one period after the previous one was due.
  nextTick_ += period_;
  const auto delay = std::max(std::chrono::steady_clock::duration::zero(), nextTick_ - std::chrono::steady_clock::now());
  timer_ = networkProcQueue_.after(delay, [self = self()] {
    if (self->sourcesCancelled_) {
      return;
    }
    self->myPeriodicTask();
    self->scheduleTick();
  });
}

void DashboardBackend::myPeriodicTask() {
  networkProcQueue_.assertCurrent();
  const std::size_t before = messageQueue_.size();
  bool changed = false;
  for (std::size_t i = 0; i < messageQueue_.size();) {
    UDPPacketToSend& packet = messageQueue_[i];
    if (packet.state() == UDPPacketToSend::kAwaitingAcknowledgement) {
      if (packet.numberOfRetransmits() > 3) {
        // Never acknowledged: the server did not take it.
        messageQueue_.erase(messageQueue_.begin() + static_cast<std::ptrdiff_t>(i));
        counters().add(BackendCount::droppedTransportError);
        continue;
      }
      const int checks = packet.numberOfChecks() + 1;
      if (checks >= kRetransmitThresholds[static_cast<std::size_t>(packet.numberOfRetransmits())]) {
        if (sendWhole(packet.data())) {
          packet.setNumberOfChecks(0);
          packet.setNumberOfRetransmits(packet.numberOfRetransmits() + 1);
          counters().add(BackendCount::retried);
          changed = true;
        }
      } else {
        packet.setNumberOfChecks(checks);
      }
      ++i;
    } else if (packet.state() == UDPPacketToSend::kNotSentWhole) {
      if (!sendWhole(packet.data())) {
        ++i;
      } else if (reliableUDP_) {
        packet.setState(UDPPacketToSend::kAwaitingAcknowledgement);
        changed = true;
        ++i;
      } else {
        messageQueue_.erase(messageQueue_.begin() + static_cast<std::ptrdiff_t>(i));
      }
    } else {
      ++i;
    }
  }
  if (changed || messageQueue_.size() != before) {
    notifyObserver();
  }

  if (cleanupState_ == kRunning) {
    return;
  }
  if (messageQueue_.empty()) {
    backendsLogger().debug("DashboardBackend(myPeriodicTask): clean up at myPeriodicTask.");
    cleanupSources();
  } else if (cleanupState_ == kCleanupRequested) {
    cleanupState_ = kLastResortScheduled;
    backendsLogger().debug("DashboardBackend(myPeriodicTask): scheduled last resort clean-up in {} ms.",
                   kLastResortCleanup.count());
    networkProcQueue_.after(kLastResortCleanup, [self = self()] { self->cleanupSources(); });
  }
}

// --- Clean-up -------------------------------------------------------------------------

void DashboardBackend::cleanup() {
  networkProcQueue_.async([self = self()] {
    if (self->messageQueue_.empty()) {
      self->cleanupSources();
    } else if (self->cleanupState_ == kRunning) {
      self->cleanupState_ = kCleanupRequested;
    }
  });
}

void DashboardBackend::cleanupSources() {
  networkProcQueue_.assertCurrent();
  if (sourcesCancelled_) {
    return;
  }
  sourcesCancelled_ = true;
  if (timer_) {
    timer_->cancel();
    timer_.reset();
    // The timer's cancel handler: the socket is its to close when no read
    // source holds it.
    if (!readSource_) {
      closeSocket();
    }
  }
  if (readSource_) {
    // The read source's cancel handler closes the socket.
    std::error_code ignored;
    readSource_->descriptor.cancel(ignored);
    readSource_->descriptor.close(ignored);
    readSource_.reset();
    socketDescriptor_ = -1;
  }
  notifyObserver();
}

void DashboardBackend::closeSocket() {
  if (socketDescriptor_ >= 0) {
    ::close(socketDescriptor_);
    socketDescriptor_ = -1;
  }
}

// --- Log data -------------------------------------------------------------------------

bool DashboardBackend::uploadLogData(const Value& logData) {
  if (!postURL_) {
    backendsLogger().error("DashboardBackend(uploadLogData): Post URL for log data array is nil");
    return false;
  }
  // The keyed archive of the array, as a binary property list.
  Data archive;
  if (logData.isArray()) {
    archive = plist::encodeBinary(logData);
  }
  if (archive.empty()) {
    backendsLogger().error("DashboardBackend(uploadLogData): Failed to serialize log data array for upload");
    return false;
  }
  const auto transport = reportingSessionConnectivityDelegate();
  if (!transport) {
    backendsLogger().error("DashboardBackend(uploadLogData): Error uploading log data array ({})", "no transport");
    return false;
  }
  URLRequest request;
  request.httpMethod = "POST";
  request.url = *postURL_;
  request.body = std::move(archive);
  request.setValue("application/octet-stream", "Content-Type");

  const URLAnswer answer = postURLRequestAndWait(*transport, request);

  if (answer.error) {
    backendsLogger().error("DashboardBackend(uploadLogData): Error uploading log data array ({})", answer.error->description);
    return false;
  }
  const std::string location(answer.data.begin(), answer.data.end());
  backendsLogger().info("DashboardBackend(uploadLogData): Log data uploaded to {}", location);
  timeval now{};
  gettimeofday(&now, nullptr);
  ZerithBackend::sendMessage(Value(Dictionary{{"LogDataUploadLocation", Value(location)}}), now, 0, 2, 0);
  return true;
}

// --- Inspection -----------------------------------------------------------------------

void DashboardBackend::notifyObserver() {
  if (observer_) {
    observer_(messageQueue_.size(), sourcesCancelled_);
  }
}

void DashboardBackend::setQueueObserver(QueueObserver observer) {
  networkProcQueue_.sync([&] { observer_ = std::move(observer); });
}

std::vector<DashboardBackend::QueuedPacket> DashboardBackend::messageQueueSnapshot() const {
  return networkProcQueue_.sync([this] {
    std::vector<QueuedPacket> out;
    for (const auto& p : messageQueue_) {
      out.push_back({p.eventNumber(), p.state(), p.numberOfChecks(), p.numberOfRetransmits()});
    }
    return out;
  });
}

int DashboardBackend::socketDescriptor() const { return networkProcQueue_.sync([this] { return socketDescriptor_; }); }
int DashboardBackend::cleanupState() const { return networkProcQueue_.sync([this] { return cleanupState_; }); }
bool DashboardBackend::hasReadSource() const { return networkProcQueue_.sync([this] { return readSource_ != nullptr; }); }
bool DashboardBackend::hasTimer() const { return networkProcQueue_.sync([this] { return timer_.has_value(); }); }
std::uint16_t DashboardBackend::boundPort() const { return boundPort_; }

}  // namespace zerith
