#include "tools/zerith-collector/CollectorServer.h"

#include <arpa/inet.h>
#include <fcntl.h>
#include <netinet/in.h>
#include <netinet/tcp.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <openssl/err.h>
#include <openssl/ssl.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <cstring>
#include <ctime>
#include <fstream>
#include <sstream>
#include <thread>
#include <vector>

#include "platform/LocalCertificateAuthority.h"

namespace zerith::collector {

namespace fs = std::filesystem;
using Json = nlohmann::ordered_json;

namespace {

constexpr std::size_t kMaxHeaderBytes = 64 * 1024;
constexpr std::size_t kMaxHeaderLines = 100;

std::string lowered(std::string_view s) {
  std::string out(s);
  std::transform(out.begin(), out.end(), out.begin(), [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
  return out;
}

std::string trimmed(std::string_view s) {
  const auto begin = s.find_first_not_of(" \t");
  if (begin == std::string_view::npos) {
    return {};
  }
  const auto end = s.find_last_not_of(" \t\r");
  return std::string(s.substr(begin, end - begin + 1));
}

const char* reasonPhrase(int status) {
  switch (status) {
    case 200: return "OK";
    case 201: return "Created";
    case 204: return "No Content";
    case 304: return "Not Modified";
    case 400: return "Bad Request";
    case 404: return "Not Found";
    case 405: return "Method Not Allowed";
    case 408: return "Request Timeout";
    case 411: return "Length Required";
    case 413: return "Payload Too Large";
    case 415: return "Unsupported Media Type";
    case 431: return "Request Header Fields Too Large";
    case 500: return "Internal Server Error";
    case 503: return "Service Unavailable";
    default: return "Status";
  }
}

std::string httpDate(std::time_t t) {
  std::tm tm{};
  gmtime_r(&t, &tm);
  char buffer[64];
  std::strftime(buffer, sizeof(buffer), "%a, %d %b %Y %H:%M:%S GMT", &tm);
  return buffer;
}

std::optional<std::time_t> parseHttpDate(const std::string& text) {
  std::tm tm{};
  const char* end = strptime(text.c_str(), "%a, %d %b %Y %H:%M:%S GMT", &tm);
  if (!end) {
    return std::nullopt;
  }
  return timegm(&tm);
}

double nowSeconds() {
  return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
}

// A line's entries as JSON text, each with its place: the keys a reader
// looks for first, in this order, then the rest (the request's headers) in
// the order they came. An envelope's record lines share the request's
// entries, written once, and add their own.
class LineText {
 public:
  explicit LineText(const Json& line) {
    for (const auto& [key, value] : line.items()) {
      add(key, value);
    }
  }
  void add(std::string_view key, const Json& value) {
    std::string text = Json(key).dump(-1, ' ', false, Json::error_handler_t::replace);
    text += ':';
    text += value.dump(-1, ' ', false, Json::error_handler_t::replace);
    entries_.push_back(Entry{placeOf(key), std::string(key), std::move(text)});
  }
  // The line, with `own`'s entries beside these (replacing any of the same key).
  std::string render(const LineText& own = LineText(Json::object())) const {
    std::vector<const Entry*> all;
    all.reserve(entries_.size() + own.entries_.size());
    for (const Entry& e : entries_) {
      const auto same = [&e](const Entry& o) { return o.key == e.key; };
      if (std::none_of(own.entries_.begin(), own.entries_.end(), same)) {
        all.push_back(&e);
      }
    }
    for (const Entry& e : own.entries_) {
      all.push_back(&e);
    }
    std::stable_sort(all.begin(), all.end(), [](const Entry* a, const Entry* b) { return a->place < b->place; });
    std::string out = "{";
    for (const Entry* e : all) {
      out += out.size() > 1 ? "," : "";
      out += e->text;
    }
    out += '}';
    return out;
  }

 private:
  struct Entry {
    std::size_t place;
    std::string key;
    std::string text;
  };
  static std::size_t placeOf(std::string_view key) {
    static constexpr std::string_view order[] = {"time",     "kind",     "status",   "method",     "path",
                                                 "query",    "digest",   "_sender",  "_sessionID", "record",
                                                 "clientId", "postTime", "events",   "gzip",       "bodySize",
                                                 "size",     "sha256",   "stored",   "storeError", "error"};
    return static_cast<std::size_t>(std::find(std::begin(order), std::end(order), key) - std::begin(order));
  }
  std::vector<Entry> entries_;
};

std::string render(const Json& line) { return LineText(line).render(); }

// Only names that cannot leave the folder: no empty, "." or ".." piece.
std::optional<fs::path> servedFile(const fs::path& folder, const std::string& path) {
  if (folder.empty() || path.empty() || path[0] != '/') {
    return std::nullopt;
  }
  fs::path out = folder;
  std::stringstream pieces(path.substr(1));
  for (std::string piece; std::getline(pieces, piece, '/');) {
    if (piece.empty() || piece == "." || piece == ".." || piece.find('\0') != std::string::npos) {
      return std::nullopt;
    }
    out /= piece;
  }
  std::error_code ec;
  if (!fs::is_regular_file(out, ec)) {
    return std::nullopt;
  }
  return out;
}

}  // namespace

// One client connection, TLS or plain, with a read buffer.
struct CollectorServer::Connection {
  int fd = -1;
  SSL* ssl = nullptr;
  std::string buffer;

  // Some bytes, or false at the end of the stream, an error or a time-out.
  bool readMore() {
    char chunk[16384];
    const int n = ssl ? SSL_read(ssl, chunk, sizeof(chunk)) : static_cast<int>(::recv(fd, chunk, sizeof(chunk), 0));
    if (n <= 0) {
      return false;
    }
    buffer.append(chunk, static_cast<std::size_t>(n));
    return true;
  }
  // After an early answer: reads and drops what the client still sends (up
  // to a bound, for a second at most), so that it reads the answer instead
  // of a reset.
  void drain() {
    timeval tv{1, 0};
    ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
    std::size_t dropped = 0;
    while (dropped < (64u << 20) && readMore()) {
      dropped += buffer.size();
      buffer.clear();
    }
  }
  bool writeAll(const std::string& data) {
    std::size_t sent = 0;
    while (sent < data.size()) {
      const int n = ssl ? SSL_write(ssl, data.data() + sent, static_cast<int>(data.size() - sent))
                        : static_cast<int>(::send(fd, data.data() + sent, data.size() - sent, MSG_NOSIGNAL));
      if (n <= 0) {
        return false;
      }
      sent += static_cast<std::size_t>(n);
    }
    return true;
  }
};

CollectorServer::CollectorServer(CollectorOptions options, LineWriter writer)
    : options_(std::move(options)), writer_(std::move(writer)) {}

CollectorServer::~CollectorServer() {
  stop();
  if (listenFd_ >= 0) {
    ::close(listenFd_);
  }
  for (int fd : wakeFds_) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
  if (sslContext_) {
    SSL_CTX_free(static_cast<SSL_CTX*>(sslContext_));
  }
}

bool CollectorServer::start(std::string* error) {
  const auto fail = [&](std::string why) {
    if (error) {
      *error = std::move(why);
    }
    return false;
  };
  if (!options_.plain) {
    SSL_CTX* ctx = SSL_CTX_new(TLS_server_method());
    sslContext_ = ctx;
    SSL_CTX_set_min_proto_version(ctx, TLS1_2_VERSION);
    if (SSL_CTX_use_certificate_chain_file(ctx, options_.certificateFile.c_str()) != 1) {
      return fail("cannot load the certificate " + options_.certificateFile.string());
    }
    if (SSL_CTX_use_PrivateKey_file(ctx, options_.keyFile.c_str(), SSL_FILETYPE_PEM) != 1 ||
        SSL_CTX_check_private_key(ctx) != 1) {
      return fail("cannot load the key " + options_.keyFile.string() + " (or it does not match the certificate)");
    }
  }
  if (::pipe2(wakeFds_, O_CLOEXEC) != 0) {
    return fail("pipe: " + std::string(std::strerror(errno)));
  }
  const bool v6 = options_.listenAddress.find(':') != std::string::npos;
  listenFd_ = ::socket(v6 ? AF_INET6 : AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
  const int yes = 1;
  ::setsockopt(listenFd_, SOL_SOCKET, SO_REUSEADDR, &yes, sizeof(yes));
  sockaddr_storage storage{};
  socklen_t length = 0;
  if (v6) {
    auto* a = reinterpret_cast<sockaddr_in6*>(&storage);
    a->sin6_family = AF_INET6;
    a->sin6_port = htons(static_cast<std::uint16_t>(options_.port));
    if (::inet_pton(AF_INET6, options_.listenAddress.c_str(), &a->sin6_addr) != 1) {
      return fail("bad listen address " + options_.listenAddress);
    }
    length = sizeof(sockaddr_in6);
  } else {
    auto* a = reinterpret_cast<sockaddr_in*>(&storage);
    a->sin_family = AF_INET;
    a->sin_port = htons(static_cast<std::uint16_t>(options_.port));
    if (::inet_pton(AF_INET, options_.listenAddress.c_str(), &a->sin_addr) != 1) {
      return fail("bad listen address " + options_.listenAddress);
    }
    length = sizeof(sockaddr_in);
  }
  if (::bind(listenFd_, reinterpret_cast<sockaddr*>(&storage), length) != 0 || ::listen(listenFd_, 128) != 0) {
    return fail("cannot listen on " + options_.listenAddress + ":" + std::to_string(options_.port) + ": " +
                std::strerror(errno));
  }
  socklen_t got = sizeof(storage);
  ::getsockname(listenFd_, reinterpret_cast<sockaddr*>(&storage), &got);
  port_ = ntohs(v6 ? reinterpret_cast<sockaddr_in6*>(&storage)->sin6_port
                   : reinterpret_cast<sockaddr_in*>(&storage)->sin_port);
  if (!options_.storeFolder.empty()) {
    std::error_code ec;
    fs::create_directories(options_.storeFolder, ec);
    if (ec) {
      return fail("cannot make the store folder " + options_.storeFolder.string() + ": " + ec.message());
    }
  }
  return true;
}

std::string CollectorServer::baseURL() const {
  const bool v6 = options_.listenAddress.find(':') != std::string::npos;
  const std::string host = v6 ? "[" + options_.listenAddress + "]" : options_.listenAddress;
  return std::string(options_.plain ? "http" : "https") + "://" + host + ":" + std::to_string(port_);
}

void CollectorServer::run() {
  while (!stopping_) {
    pollfd fds[2] = {{listenFd_, POLLIN, 0}, {wakeFds_[0], POLLIN, 0}};
    if (::poll(fds, 2, -1) < 0) {
      if (errno == EINTR) {
        continue;
      }
      break;
    }
    if (fds[1].revents) {
      break;
    }
    const int fd = ::accept4(listenFd_, nullptr, nullptr, SOCK_CLOEXEC);
    if (fd < 0) {
      continue;
    }
    std::unique_lock lock(mutex_);
    if (threads_ >= options_.maxConnections || stopping_) {
      lock.unlock();
      ::close(fd);  // over the limit: the client retries or fails
      continue;
    }
    ++threads_;
    connections_.insert(fd);
    lock.unlock();
    std::thread([this, fd] {
      serveConnection(fd);
      std::lock_guard guard(mutex_);
      connections_.erase(fd);
      ::close(fd);
      --threads_;
      idle_.notify_all();
    }).detach();
  }
}

void CollectorServer::stop() {
  if (stopping_.exchange(true)) {
    std::unique_lock lock(mutex_);
    idle_.wait(lock, [&] { return threads_ == 0; });
    return;
  }
  if (wakeFds_[1] >= 0) {
    const char byte = 0;
    (void)!::write(wakeFds_[1], &byte, 1);
  }
  std::unique_lock lock(mutex_);
  for (int fd : connections_) {
    ::shutdown(fd, SHUT_RDWR);
  }
  idle_.wait(lock, [&] { return threads_ == 0; });
}

std::optional<Behaviour> Behaviour::parse(std::string_view text) {
  std::istringstream in{std::string(text)};
  std::string word;
  in >> word;
  Behaviour b;
  if (word.empty() || word == "answer") {
    return b;
  }
  if (word == "close") {
    b.kind = Kind::close;
    return b;
  }
  long long n = -1;
  if (!(in >> n)) {
    return std::nullopt;
  }
  if (word == "status" && n >= 100 && n <= 599) {
    b.kind = Kind::status;
  } else if (word == "stall" && n >= 0 && n <= 600000) {
    b.kind = Kind::stall;
  } else {
    return std::nullopt;
  }
  b.value = static_cast<int>(n);
  return b;
}

void CollectorServer::setBehaviour(Behaviour behaviour) {
  std::lock_guard lock(behaviourMutex_);
  behaviour_ = behaviour;
}

std::uint64_t CollectorServer::distinctRecords() const {
  std::lock_guard lock(behaviourMutex_);
  return seenRecordIDs_.size();
}

Behaviour CollectorServer::behaviour() {
  std::lock_guard lock(behaviourMutex_);
  if (!options_.behaviourFile.empty()) {
    std::ifstream in(options_.behaviourFile);
    std::string text((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
    if (in.is_open()) {
      if (auto parsed = Behaviour::parse(text)) {
        return *parsed;
      }
      writer_(render(Json{{"time", nowSeconds()}, {"kind", "refused"}, {"error", "bad behaviour file text: " + text}}));
    }
  }
  return behaviour_;
}

void CollectorServer::serveConnection(int fd) {
  if (behaviour().kind == Behaviour::Kind::close) {
    writer_(render(Json{{"time", nowSeconds()}, {"kind", "closed"}}));
    return;  // the caller closes the socket
  }
  timeval tv{options_.idleTimeoutSeconds, 0};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof(tv));
  ::setsockopt(fd, SOL_SOCKET, SO_SNDTIMEO, &tv, sizeof(tv));
  const int yes = 1;
  ::setsockopt(fd, IPPROTO_TCP, TCP_NODELAY, &yes, sizeof(yes));
  Connection connection;
  connection.fd = fd;
  if (sslContext_) {
    connection.ssl = SSL_new(static_cast<SSL_CTX*>(sslContext_));
    SSL_set_fd(connection.ssl, fd);
    if (SSL_accept(connection.ssl) != 1) {
      ERR_clear_error();
      SSL_free(connection.ssl);
      return;
    }
  }
  handle(connection);
  if (connection.ssl) {
    SSL_shutdown(connection.ssl);
    SSL_free(connection.ssl);
    ERR_clear_error();
  }
}

void CollectorServer::handle(Connection& connection) {
  while (!stopping_) {
    // The header block.
    std::size_t headerEnd;
    while ((headerEnd = connection.buffer.find("\r\n\r\n")) == std::string::npos) {
      if (connection.buffer.size() > kMaxHeaderBytes) {
        connection.writeAll("HTTP/1.1 431 Request Header Fields Too Large\r\nContent-Length: 0\r\nConnection: close\r\n\r\n");
        writer_(render(Json{{"time", nowSeconds()}, {"kind", "refused"}, {"error", "header block too large"}}));
        return;
      }
      if (!connection.readMore()) {
        return;  // closed, failed or idle
      }
    }
    const std::string head = connection.buffer.substr(0, headerEnd);
    connection.buffer.erase(0, headerEnd + 4);

    std::vector<std::string> lines;
    for (std::size_t at = 0; at <= head.size();) {
      const auto next = head.find("\r\n", at);
      lines.push_back(head.substr(at, next == std::string::npos ? std::string::npos : next - at));
      if (next == std::string::npos) {
        break;
      }
      at = next + 2;
    }
    Json line{{"time", nowSeconds()}};
    const auto refuse = [&](int status, const std::string& why) {
      line["kind"] = "refused";
      line["status"] = status;
      line["error"] = why;
      writer_(render(line));
      connection.writeAll("HTTP/1.1 " + std::to_string(status) + " " + reasonPhrase(status) +
                          "\r\nContent-Length: 0\r\nConnection: close\r\n\r\n");
      connection.drain();
    };
    std::istringstream requestLine(lines[0]);
    std::string method, target, version;
    requestLine >> method >> target >> version;
    if (method.empty() || target.empty() || version.rfind("HTTP/1.", 0) != 0) {
      refuse(400, "bad request line");
      return;
    }
    const auto question = target.find('?');
    const std::string path = target.substr(0, question);
    const std::string query = question == std::string::npos ? std::string() : target.substr(question + 1);
    line["method"] = method;
    line["path"] = path;
    line["query"] = query;
    if (lines.size() - 1 > kMaxHeaderLines) {
      refuse(431, "more than " + std::to_string(kMaxHeaderLines) + " header lines");
      return;
    }
    auto headers = Json::array();
    std::optional<std::size_t> contentLength;
    std::string contentEncoding, digestHeader, ifModifiedSince;
    bool chunked = false;
    bool keepAlive = version == "HTTP/1.1";
    for (std::size_t i = 1; i < lines.size(); ++i) {
      const auto colon = lines[i].find(':');
      if (colon == std::string::npos || colon == 0) {
        refuse(400, "malformed header line");
        return;
      }
      const std::string name = lines[i].substr(0, colon);
      const std::string value = trimmed(std::string_view(lines[i]).substr(colon + 1));
      headers.push_back(Json::array({name, value}));
      const std::string key = lowered(name);
      if (key == "content-length") {
        if (value.empty() || value.size() > 18 || !std::all_of(value.begin(), value.end(), ::isdigit) ||
            (contentLength && *contentLength != std::stoull(value))) {
          refuse(400, "bad Content-Length");
          return;
        }
        contentLength = std::stoull(value);
      } else if (key == "transfer-encoding") {
        chunked = lowered(value) != "identity";
      } else if (key == "content-encoding") {
        contentEncoding = value;
      } else if (key == "x-zth-digest") {
        digestHeader = value;
      } else if (key == "if-modified-since") {
        ifModifiedSince = value;
      } else if (key == "connection") {
        const std::string v = lowered(value);
        keepAlive = v == "close" ? false : (v == "keep-alive" ? true : keepAlive);
      }
    }
    line["headers"] = std::move(headers);

    if (chunked) {
      refuse(411, "chunked bodies are not taken: send Content-Length");
      return;
    }
    const std::size_t length = contentLength.value_or(0);
    if (length > options_.limits.maxBodyBytes) {
      refuse(413, "body of " + std::to_string(length) + " bytes exceeds " + std::to_string(options_.limits.maxBodyBytes));
      return;
    }
    while (connection.buffer.size() < length) {
      if (!connection.readMore()) {
        return;
      }
    }
    const std::string body = connection.buffer.substr(0, length);
    connection.buffer.erase(0, length);

    const auto answer = [&](int status, const std::string& text, const std::string& extraHeaders = {}) {
      return connection.writeAll("HTTP/1.1 " + std::to_string(status) + " " + reasonPhrase(status) +
                                 "\r\nContent-Type: text/plain; charset=utf-8\r\nContent-Length: " +
                                 std::to_string(text.size()) + "\r\n" + extraHeaders +
                                 (keepAlive ? "" : "Connection: close\r\n") + "\r\n" + text);
    };

    if (method == "GET" || method == "HEAD") {
      line["kind"] = "get";
      const auto file = servedFile(options_.serveFolder, path);
      if (!file) {
        line["status"] = 404;
        writer_(render(line));
        if (!answer(404, "") || !keepAlive) {
          return;
        }
        continue;
      }
      struct stat st {};
      ::stat(file->c_str(), &st);
      const std::string lastModified = "Last-Modified: " + httpDate(st.st_mtime) + "\r\n";
      const auto since = parseHttpDate(ifModifiedSince);
      if (since && st.st_mtime <= *since) {
        line["status"] = 304;
        writer_(render(line));
        if (!connection.writeAll("HTTP/1.1 304 Not Modified\r\n" + lastModified + (keepAlive ? "" : "Connection: close\r\n") + "\r\n") ||
            !keepAlive) {
          return;
        }
        continue;
      }
      std::ifstream in(*file, std::ios::binary);
      std::string contents((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
      line["status"] = 200;
      line["size"] = contents.size();
      writer_(render(line));
      const std::string sent = method == "HEAD" ? std::string() : contents;
      if (!connection.writeAll("HTTP/1.1 200 OK\r\nContent-Type: application/octet-stream\r\nContent-Length: " +
                               std::to_string(contents.size()) + "\r\n" + lastModified +
                               (keepAlive ? "" : "Connection: close\r\n") + "\r\n" + sent) ||
          !keepAlive) {
        return;
      }
      continue;
    }
    if (method != "POST" && method != "PUT") {
      refuse(405, "method " + method + " is not taken");
      return;
    }

    const Behaviour now = behaviour();
    if (now.kind == Behaviour::Kind::close) {
      // A connection kept alive from before: closed at its next request.
      line["kind"] = "closed";
      writer_(render(line));
      return;
    }
    if (now.kind == Behaviour::Kind::stall) {
      const auto until = std::chrono::steady_clock::now() + std::chrono::milliseconds(now.value);
      while (!stopping_ && std::chrono::steady_clock::now() < until) {
        std::this_thread::sleep_for(std::chrono::milliseconds(5));
      }
      line["kind"] = "stalled";
      line["bodySize"] = body.size();
      writer_(render(line));
      return;  // closed without an answer
    }
    const int status = now.kind == Behaviour::Kind::status ? now.value : options_.status;

    const DecodedBody decoded = decodeRequestBody(contentEncoding, body, options_.limits);
    if (!decoded.ok) {
      refuse(decoded.error.find("exceeds") != std::string::npos || decoded.error.find("beyond") != std::string::npos ? 413 : 415,
             decoded.error);
      return;
    }
    line["status"] = status;
    line["bodySize"] = body.size();
    line["gzip"] = decoded.wasGzip;
    if (options_.digestKey) {
      line["digest"] = digestHeader.empty()
                           ? "missing"
                           : (digestHeader == digestHeaderValue(*options_.digestKey, decoded.bytes) ? "valid" : "invalid");
    }

    std::string answerText;
    if (decoded.envelope) {
      const Json& envelope = *decoded.envelope;
      Json common = line;
      common["postTime"] = envelope["postTime"];
      if (envelope.contains("clientId")) {
        common["clientId"] = envelope["clientId"];
      }
      static const Json kNoEvents = Json::array();
      const Json& events = envelope.contains("events") ? envelope["events"] : kNoEvents;
      if (events.empty()) {
        common["kind"] = "envelope";
        common["events"] = 0;
        writer_(render(common));
      }
      // The envelope's lines leave together, before its answer.
      const LineText shared(common);
      std::string lines;
      const auto add = [&lines](const std::string& text) {
        lines += lines.empty() ? "" : "\n";
        lines += text;
      };
      const bool taken = status >= 200 && status <= 299;
      for (const Json& record : events) {
        if (options_.dropDuplicates && taken && record.is_object() && record.contains("_recordID") &&
            record["_recordID"].is_string()) {
          std::lock_guard lock(behaviourMutex_);
          if (!seenRecordIDs_.insert(record["_recordID"].get<std::string>()).second) {
            ++duplicates_;
            add(shared.render(LineText(Json{{"kind", "duplicate"},
                                            {"_recordID", record["_recordID"]},
                                            {"duplicates", duplicates_.load()}})));
            continue;
          }
        }
        LineText own(Json{{"kind", "record"}});
        const auto member = [&record](const char* key) {
          return record.is_object() && record.contains(key) ? record[key] : Json(nullptr);
        };
        own.add("_sender", member("_sender"));
        own.add("_sessionID", member("_sessionID"));
        own.add("record", record);
        add(shared.render(own));
      }
      if (!lines.empty()) {
        writer_(lines);
      }
    } else {
      const bool logData = path == options_.logDataPath;
      line["kind"] = logData ? "logdata" : "upload";
      line["size"] = decoded.bytes.size();
      const std::string digest = sha256Hex(decoded.bytes);
      line["sha256"] = digest;
      std::string stored;
      if (!options_.storeFolder.empty()) {
        const auto number = ++stored_;
        const fs::path file = options_.storeFolder / (std::to_string(number) + "-" + digest.substr(0, 16) + ".bin");
        std::ofstream out(file, std::ios::binary);
        out.write(decoded.bytes.data(), static_cast<std::streamsize>(decoded.bytes.size()));
        if (out.good()) {
          stored = file.string();
          line["stored"] = stored;
        } else {
          line["storeError"] = "cannot write " + file.string();
        }
      }
      writer_(render(line));
      answerText = logData ? stored : options_.answerText;
    }
    if (!answer(status, answerText) || !keepAlive) {
      return;
    }
  }
}

// ---------------------------------------------------------------------------
// Certificates

bool generateCertificates(const fs::path& folder, std::string* error) {
  const auto fail = [&](std::string why) {
    if (error) {
      *error = std::move(why);
    }
    return false;
  };
  std::error_code ec;
  fs::create_directories(folder, ec);
  if (ec) {
    return fail("cannot make " + folder.string() + ": " + ec.message());
  }
  if (fs::exists(folder / "ca.pem") && fs::exists(folder / "cert.pem") && fs::exists(folder / "key.pem")) {
    return true;
  }
  constexpr std::chrono::seconds kYear = std::chrono::hours(24 * 365);
  const auto ca = LocalCertificateAuthority::create("zerith-collector local CA", kYear, error);
  const auto server = ca ? ca->issueServerCertificate({"localhost"}, {"127.0.0.1", "::1"}, kYear, error) : std::nullopt;
  if (!server) {
    return false;
  }
  if (!ca->writeFiles(folder, *server)) {
    return fail("cannot write the certificate files into " + folder.string());
  }
  return true;
}

}  // namespace zerith::collector
