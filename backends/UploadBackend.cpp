#include "backends/UploadBackend.h"
#include "backends/BackendsLog.h"


#include <fmt/format.h>

#include "config/Compression.h"
#include "platform/Log.h"
#include "platform/SandboxExtension.h"

namespace zerith {

namespace {

constexpr char kUploadDescription[] = "Vidra AFRC log";

bool allowedInQuery(unsigned char c) {
  if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
    return true;
  }
  return std::string_view("!$&'()*+,-./:;=?@_~").find(static_cast<char>(c)) != std::string_view::npos;
}

std::string lastPathComponent(const std::string& path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') {
    trimmed.pop_back();
  }
  const auto slash = trimmed.rfind('/');
  return slash == std::string::npos ? trimmed : trimmed.substr(slash + 1);
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

bool UploadBackend::uploadFileAtPath(const std::string& path, const char* extensionToken) {
  backendsLogger().debug("UploadBackend(uploadFileAtPath): Uploading file {}", path);
  const auto base = uploadURL();
  if (!base) {
    return false;
  }
  // The session's token stands for the file it opened with the client's
  // rights; without one the backend opens the path for its own user.
  std::shared_ptr<sandbox::GrantedFile> file = sandbox::consumeExtension(extensionToken);
  std::string why;
  if (!file) {
    file = sandbox::GrantedFile::open(path, sandbox::Identity::ofProcess(), &why);
  } else if (file->path() != path) {
    why = "the extension token stands for another file";
    file.reset();
  }
  if (!file) {
    backendsLogger().error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
    backendsLogger().debug("UploadBackend(uploadFileAtPath): {}: {}", path, why);
    return false;
  }

  std::optional<Data> body;
  {
    std::optional<Data> contents = file->readAll(&why);
    if (!contents) {
      backendsLogger().error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
      backendsLogger().debug("UploadBackend(uploadFileAtPath): {}: {}", path, why);
      return false;
    }
    if (contents->empty()) {
      backendsLogger().error("UploadBackend(uploadFileAtPath): Input file is empty");
      return false;
    }
    body = gzipDeflate(*contents);
  }
  const auto transport = reportingSessionConnectivityDelegate();
  if (!body || !transport) {
    backendsLogger().error("UploadBackend(uploadFileAtPath): Unable to create URL request");
    return false;
  }

  URLRequest request;
  request.httpMethod = "POST";
  request.url = uploadAddressForFileName(lastPathComponent(path));
  request.setValue("application/octet-stream", "Content-Type");
  request.setValue("gzip", "Content-Encoding");
  request.body = std::move(*body);

  const URLAnswer answer = postURLRequestAndWait(*transport, request);

  if (!answer.data.empty()) {
    const std::string text(answer.data.begin(), answer.data.end());
    backendsLogger().debug("UploadBackend(uploadFileAtPath): sending to |{}|, Json output: {}", *base, text);
    if (text.find("success") != std::string::npos) {
      if (!file->remove(&why)) {
        backendsLogger().debug("UploadBackend(uploadFileAtPath): {} not removed: {}", path, why);
      }
    }
  } else {
    backendsLogger().error("UploadBackend(uploadFileAtPath): post {}",
                   answer.error ? answer.error->description : std::string("(null)"));
  }
  return true;
}

}  // namespace zerith
