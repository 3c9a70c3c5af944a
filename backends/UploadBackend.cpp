#include "backends/UploadBackend.h"
#include "backends/BackendsLog.h"


#include <algorithm>
#include <list>
#include <unordered_map>
#include <utility>
#include <vector>

#include <fmt/format.h>

#include "config/Compression.h"
#include "config/StorebagDiskCache.h"
#include "transport/URLSession.h"
#include "platform/DefaultsKeys.h"
#include "platform/Log.h"
#include "platform/SandboxExtension.h"

namespace zerith {

namespace {

constexpr char kUploadDescription[] = "Vidra AFRC log";
constexpr std::int64_t kCurlTimedOut = 28;  // CURLE_OPERATION_TIMEDOUT

bool allowedInQuery(unsigned char c) {
  if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
    return true;
  }
  return std::string_view("!$&'()*+,-./:;=?@_~").find(static_cast<char>(c)) != std::string_view::npos;
}


}  // namespace

UploadBackend::UploadBackend(Token, std::string name, Value profile, std::optional<std::string> productFamily)
    : ZerithBackend(std::move(name), std::move(profile), std::move(productFamily)) {}

std::shared_ptr<UploadBackend> UploadBackend::initWithName(std::string name, Value profile,
                                                           std::optional<std::string> productFamily) {
  const Value postURL = profile["post_url"];
  if (!postURL.string()) {
    backendsLogger().error("UploadBackend(initWithName): can't resolve upload post URL.");
    return nullptr;
  }
  auto backend = std::make_shared<UploadBackend>(Token{}, std::move(name), profile, std::move(productFamily));
  backend->setUploadURL(*postURL.string());
  if (const Value display = profile["display_url"]; display.string()) {
    backend->setDisplayURL(*display.string());
  }
  return backend;
}

std::optional<std::string> UploadBackend::uploadURL() const {
  std::lock_guard lock(uploadURLMutex_);
  return uploadURL_;
}

void UploadBackend::setUploadURL(std::optional<std::string> url) {
  std::lock_guard lock(uploadURLMutex_);
  uploadURL_ = std::move(url);
}

std::string UploadBackend::percentEncodeQuery(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char ch : text) {
    const auto c = static_cast<unsigned char>(ch);
    if (allowedInQuery(c)) {
      out.push_back(ch);
    } else {
      out += fmt::format("%{:02X}", c);
    }
  }
  return out;
}

std::string UploadBackend::uploadAddressForFileName(std::string_view fileName) const {
  const char* id = udid();
  return fmt::format("{}?uuid={}&sequence={}&description={}%20(Uploaded%20by%20QPX)&filename={}&raw=true",
                     uploadURL().value_or(std::string()), id != nullptr ? id : "", sessionID(),
                     percentEncodeQuery(kUploadDescription), percentEncodeQuery(std::string(fileName) + ".gz"));
}

// --- the gate: how many uploads run and wait ------------------------------------------

struct UploadBackend::Exchange {
  UploadRequest request;
  UploadCompletion completion;
  UploadLimits limits;
  std::weak_ptr<UploadBackend> backend;
  std::string name;  // escaped, for the logs
  std::mutex mutex;
  bool done = false;
  bool holdsSlot = false;
  bool queued = false;
  SerialQueue::Timer guard;
};

namespace {

struct Gate {
  std::mutex mutex;
  UploadLimits limits;  // the latest read
  std::size_t running = 0;
  std::unordered_map<uid_t, std::size_t> runningPer;
  std::unordered_map<uid_t, std::size_t> waitingPer;
  std::list<std::shared_ptr<UploadBackend::Exchange>> waiting;

  bool hasRoom(uid_t uid) {
    return running < limits.atOnce && runningPer[uid] < limits.perClient;
  }
};

Gate& gate() {
  static Gate* g = new Gate;  // outlives every session
  return *g;
}

const SerialQueue& timerQueue() {
  static const SerialQueue queue("com.velmar.zerith.upload-timers");
  return queue;
}

}  // namespace

UploadLoad uploadLoad() {
  std::lock_guard lock(gate().mutex);
  return UploadLoad{gate().running, gate().waiting.size()};
}

UploadLimits UploadLimits::fromDefaults() {
  UploadLimits limits;
  const auto number = [](const DefaultsSetting& setting) -> std::optional<double> {
    std::string problem;
    const auto n = defaultsNumber(setting, defaultsObjectForKey(setting.key), &problem);
    if (!problem.empty()) {
      backendsLogger().error("UploadBackend: defaults key \"{}\" {}; using the default", setting.key, problem);
    }
    return n;
  };
  if (const auto seconds = number(defaultsSetting("uploadTimeoutSeconds"))) {
    limits.timeLimit = std::chrono::milliseconds(static_cast<long long>(*seconds * 1000));
  }
  if (const auto n = number(defaultsSetting("uploadsAtOnce"))) {
    limits.atOnce = static_cast<std::size_t>(*n);
  }
  if (const auto n = number(defaultsSetting("uploadsPerClient"))) {
    limits.perClient = static_cast<std::size_t>(*n);
  }
  return limits;
}

namespace {

// Hands the exchanges that got a slot to threads of the pool.
void startAdmitted(std::vector<std::shared_ptr<UploadBackend::Exchange>> admitted,
                   const std::function<void(const std::shared_ptr<UploadBackend::Exchange>&)>& run);

// Gives a slot back and lets the waiters that now have room run.
void leaveGate(uid_t uid, const std::function<void(const std::shared_ptr<UploadBackend::Exchange>&)>& run) {
  std::vector<std::shared_ptr<UploadBackend::Exchange>> admitted;
  {
    Gate& g = gate();
    std::lock_guard lock(g.mutex);
    --g.running;
    --g.runningPer[uid];
    for (auto it = g.waiting.begin(); it != g.waiting.end() && g.running < g.limits.atOnce;) {
      const uid_t who = (*it)->request.client;
      if (!g.hasRoom(who)) {
        ++it;
        continue;
      }
      ++g.running;
      ++g.runningPer[who];
      --g.waitingPer[who];
      admitted.push_back(*it);
      it = g.waiting.erase(it);
    }
  }
  startAdmitted(std::move(admitted), run);
}

void startAdmitted(std::vector<std::shared_ptr<UploadBackend::Exchange>> admitted,
                   const std::function<void(const std::shared_ptr<UploadBackend::Exchange>&)>& run) {
  for (auto& exchange : admitted) {
    bool gone = false;
    {
      std::lock_guard lock(exchange->mutex);
      exchange->queued = false;
      gone = exchange->done;
      exchange->holdsSlot = !gone;
    }
    if (gone) {
      leaveGate(exchange->request.client, run);
      continue;
    }
    SerialQueue("com.velmar.zerith.upload").async([exchange, run] { run(exchange); });
  }
}

}  // namespace

namespace {

// Ends an exchange once: gives its slot back or leaves the queue, and
// answers.
void finish(const std::shared_ptr<UploadBackend::Exchange>& exchange, bool taken, bool serverSucceeded,
            const std::function<void(const std::shared_ptr<UploadBackend::Exchange>&)>& run) {
  bool slot = false;
  bool queued = false;
  {
    std::lock_guard lock(exchange->mutex);
    if (exchange->done) {
      return;
    }
    exchange->done = true;
    slot = std::exchange(exchange->holdsSlot, false);
    queued = std::exchange(exchange->queued, false);
  }
  exchange->guard.cancel();
  if (queued) {
    Gate& g = gate();
    std::lock_guard lock(g.mutex);
    if (const auto it = std::find(g.waiting.begin(), g.waiting.end(), exchange); it != g.waiting.end()) {
      g.waiting.erase(it);
      --g.waitingPer[exchange->request.client];
    }
  }
  if (slot) {
    leaveGate(exchange->request.client, run);
  }
  auto completion = std::move(exchange->completion);
  if (completion) {
    completion(taken, serverSucceeded);
  }
}

}  // namespace

void UploadBackend::uploadFileAtPath(const UploadRequest& request, UploadCompletion completion) {
  auto exchange = std::make_shared<Exchange>();
  exchange->request = request;
  exchange->completion = std::move(completion);
  exchange->limits = UploadLimits::fromDefaults();
  exchange->backend = std::static_pointer_cast<UploadBackend>(shared_from_this());
  exchange->name = log::escaped(request.name);
  backendsLogger().debug("UploadBackend(uploadFileAtPath): Uploading file {}", exchange->name);

  const auto run = [](const std::shared_ptr<Exchange>& e) {
    if (const auto backend = e->backend.lock()) {
      backend->run(e);
    } else {
      finish(e, false, false, nullptr);
    }
  };
  if (!uploadURL() || !request.file) {
    finish(exchange, false, false, run);
    return;
  }

  enum class Admission { Run, Wait, Refuse } admission = Admission::Refuse;
  std::size_t running = 0;
  std::size_t waiting = 0;
  {
    Gate& g = gate();
    std::lock_guard lock(g.mutex);
    g.limits = exchange->limits;
    const uid_t who = request.client;
    if (g.hasRoom(who) && g.waitingPer[who] == 0) {
      ++g.running;
      ++g.runningPer[who];
      exchange->holdsSlot = true;
      admission = Admission::Run;
    } else if (g.waiting.size() < g.limits.waiting && g.waitingPer[who] < g.limits.waitingPerClient) {
      g.waiting.push_back(exchange);
      ++g.waitingPer[who];
      exchange->queued = true;
      admission = Admission::Wait;
    }
    running = g.running;
    waiting = g.waiting.size();
  }
  if (admission == Admission::Refuse) {
    backendsLogger().error(
        "UploadBackend(uploadFileAtPath): refusing {} of user {}: {} uploads run and {} wait already", exchange->name,
        request.client, running, waiting);
    finish(exchange, false, false, run);
    return;
  }
  const auto left = request.deadline - std::chrono::steady_clock::now();
  exchange->guard = timerQueue().after(left, [weak = std::weak_ptr<Exchange>(exchange), run] {
    const auto e = weak.lock();
    if (!e) {
      return;
    }
    backendsLogger().error("UploadBackend(uploadFileAtPath): {}: no answer within the time limit of {} ms; answering NO",
                           e->name, e->limits.timeLimit.count());
    finish(e, false, false, run);
  });
  if (admission == Admission::Wait) {
    backendsLogger().debug("UploadBackend(uploadFileAtPath): {} waits its turn ({} uploads run, {} wait)",
                           exchange->name, running, waiting);
    return;
  }
  // Reading and compressing are work, not a wait: a thread of the pool does
  // them, never the caller's connection.
  SerialQueue("com.velmar.zerith.upload").async([exchange, run] { run(exchange); });
}

void UploadBackend::run(const std::shared_ptr<Exchange>& exchange) {
  const auto again = [](const std::shared_ptr<Exchange>& e) {
    if (const auto backend = e->backend.lock()) {
      backend->run(e);
    } else {
      finish(e, false, false, nullptr);
    }
  };
  const auto no = [&](bool taken = false) { finish(exchange, taken, false, again); };
  {
    std::lock_guard lock(exchange->mutex);
    if (exchange->done) {
      return;
    }
  }
  const std::string& name = exchange->name;
  if (std::chrono::steady_clock::now() >= exchange->request.deadline) {
    // Its turn came too late: nothing is read or posted.
    backendsLogger().error("UploadBackend(uploadFileAtPath): {}: no answer within the time limit; answering NO", name);
    return no();
  }
  std::string why;
  std::optional<Data> body;
  {
    std::optional<Data> contents = exchange->request.file->readAll(&why);
    if (!contents) {
      backendsLogger().error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
      backendsLogger().error("UploadBackend(uploadFileAtPath): {}: {}", name, why);
      return no();
    }
    if (contents->empty()) {
      backendsLogger().error("UploadBackend(uploadFileAtPath): Input file is empty");
      return no();
    }
    body = gzipDeflate(*contents);
  }
  const auto transport = reportingSessionConnectivityDelegate();
  const auto base = uploadURL();
  std::optional<std::string> address;
  if (body && transport && base) {
    address = postableURL(uploadAddressForFileName(exchange->request.name), &why);
    if (!address) {
      backendsLogger().error("UploadBackend(uploadFileAtPath): post error: {}", log::escaped(why));
    }
  }
  if (!address) {
    backendsLogger().error("UploadBackend(uploadFileAtPath): Unable to create URL request");
    return no();
  }

  URLRequest request;
  request.httpMethod = "POST";
  request.url = *address;
  request.setValue("application/octet-stream", "Content-Type");
  request.setValue("gzip", "Content-Encoding");
  request.body = std::move(*body);
  const auto left =
      std::chrono::duration<double>(exchange->request.deadline - std::chrono::steady_clock::now()).count();
  request.timeoutSeconds = std::max(left, 0.001);
  request.completesWhenBodyFails = true;

  transport->postURLRequestWithCompletionHandler(
      request, [exchange, again, url = *base](const Data& data, const std::optional<HTTPURLResponse>&,
                                              const std::optional<Error>& error) {
        if (error && error->domain == kURLErrorDomain &&
            (error->code == kURLErrorCannotWriteBody || error->code == kCurlTimedOut)) {
          backendsLogger().error("UploadBackend(uploadFileAtPath): {}: {}; answering NO", exchange->name,
                                 error->description);
          finish(exchange, false, false, again);
          return;
        }
        bool succeeded = false;
        if (!data.empty()) {
          const std::string text(data.begin(), data.end());
          backendsLogger().debug("UploadBackend(uploadFileAtPath): sending to |{}|, Json output: {}", url,
                                 log::escaped(text));
          succeeded = text.find("success") != std::string::npos;
        } else {
          backendsLogger().error("UploadBackend(uploadFileAtPath): post {}",
                                 error ? error->description : std::string("(null)"));
        }
        // Posted: YES, whatever the server said; "success" lets the client
        // framework delete the file.
        finish(exchange, true, succeeded, again);
      });
}

}  // namespace zerith
