// The C API over the C++ Zerith class.

#include <cstdlib>
#include <cstring>
#include <mutex>

#include <nlohmann/json.hpp>

#include "ipc/ClientSessionWire.h"
#include "platform/Json.h"
#include "platform/PropertyList.h"
#include "zerith/Zerith.h"
#include "zerith/zerith.h"

using zerith::Value;
namespace wire = zerith::ipc::wire;

struct zerith_session {
  zerith_format format = ZERITH_FORMAT_JSON;
  std::unique_ptr<zerith::Zerith> session;
};

namespace {

thread_local std::string tLastError;

int fail(std::string why) {
  tLastError = std::move(why);
  return -1;
}

char* copyText(const std::string& s) {
  char* out = static_cast<char*>(std::malloc(s.size() + 1));
  if (out) {
    std::memcpy(out, s.c_str(), s.size() + 1);
  }
  return out;
}

// Text in the session's format -> Value. NULL is nil.
bool parse(const zerith_session* s, const char* text, const char* what, Value& out) {
  if (!text) {
    out = Value();
    return true;
  }
  if (s->format == ZERITH_FORMAT_JSON) {
    std::string why;
    auto parsed = zerith::json::parseValue(text, &why);
    if (!parsed) {
      fail(std::string(what) + " " + why);
      return false;
    }
    out = std::move(*parsed);
    return true;
  }
  std::string why;
  auto decoded = zerith::plist::decodeXml(zerith::plist::bytesOf(std::string(text)), {}, &why);
  if (!decoded) {
    fail(std::string(what) + " is not an XML property list: " + why);
    return false;
  }
  out = std::move(*decoded);
  return true;
}

bool parseContainer(const zerith_session* s, const char* text, const char* what, bool array, Value& out) {
  if (!parse(s, text, what, out)) {
    return false;
  }
  if (!out.isNil() && (array ? !out.isArray() : !out.isDict())) {
    fail(std::string(what) + (array ? " is not an array" : " is not a dictionary"));
    return false;
  }
  return true;
}

std::string render(zerith_format format, const Value& v) {
  return format == ZERITH_FORMAT_JSON ? zerith::json::serialize(v) : zerith::plist::encodeXml(v);
}

zerith::Zerith* connected(zerith_session* s) {
  if (!s) {
    fail("no session");
    return nullptr;
  }
  if (!s->session) {
    fail("the session is not connected");
    return nullptr;
  }
  return s->session.get();
}

std::function<void(zerith::ZerithReply)> replyTo(const zerith_session* s, zerith_reply_callback callback, void* context) {
  if (!callback) {
    return nullptr;
  }
  return [format = s->format, callback, context](zerith::ZerithReply reply) {
    if (reply.error) {
      callback(context, nullptr, reply.error->description.c_str());
      return;
    }
    const std::string text = render(format, Value(reply.arguments));
    callback(context, text.c_str(), nullptr);
  };
}

int call(zerith_session* s, const char* operation, zerith::Dictionary args, zerith_reply_callback callback, void* context) {
  auto* z = connected(s);
  if (!z) {
    return -1;
  }
  z->call(operation, std::move(args), replyTo(s, callback, context));
  return 0;
}

}  // namespace

extern "C" {

zerith_session* zerith_create(zerith_format format) {
  if (format != ZERITH_FORMAT_JSON && format != ZERITH_FORMAT_PLIST_XML) {
    fail("unknown text format");
    return nullptr;
  }
  auto* s = new (std::nothrow) zerith_session();
  if (s) {
    s->format = format;
  }
  return s;
}

int zerith_connect(zerith_session* session, const char* socket_path) {
  if (!session) {
    return fail("no session");
  }
  if (session->session) {
    return fail("the session is already connected");
  }
  zerith::Error error;
  session->session = zerith::Zerith::connect(socket_path ? std::filesystem::path(socket_path) : std::filesystem::path(), &error);
  return session->session ? 0 : fail(error.description);
}

void zerith_destroy(zerith_session* session) { delete session; }

const char* zerith_last_error(void) { return tLastError.c_str(); }

void zerith_free(char* text) { std::free(text); }

void zerith_set_message_callback(zerith_session* session, zerith_message_callback callback, void* context) {
  auto* z = connected(session);
  if (!z) {
    return;
  }
  if (!callback) {
    z->setMessageHandler(nullptr);
    return;
  }
  z->setMessageHandler([format = session->format, callback, context](const Value& message, double timestamp,
                                                                      std::uint16_t category, std::uint16_t type,
                                                                      const Value& payload) {
    const std::string m = message.isNil() ? std::string() : render(format, message);
    const std::string p = payload.isNil() ? std::string() : render(format, payload);
    callback(context, message.isNil() ? nullptr : m.c_str(), timestamp, category, type,
             payload.isNil() ? nullptr : p.c_str());
  });
}

void zerith_set_invalidation_callback(zerith_session* session, zerith_invalidation_callback callback, void* context) {
  auto* z = connected(session);
  if (!z) {
    return;
  }
  z->setInvalidationHandler(callback ? std::function<void()>([callback, context] { callback(context); }) : nullptr);
}

int zerith_set_session_info(zerith_session* session, const char* session_info, const char* user_info,
                            const char* frameworks_to_check, int has_aggregation_block) {
  Value info, user, frameworks;
  if (!session || !parseContainer(session, session_info, "session info", false, info) ||
      !parseContainer(session, user_info, "user info", false, user) ||
      !parseContainer(session, frameworks_to_check, "frameworks to check", true, frameworks)) {
    return -1;
  }
  auto* z = connected(session);
  if (!z) {
    return -1;
  }
  z->setSessionInfo(info, user, frameworks, has_aggregation_block != 0);
  return 0;
}

int zerith_start_config(zerith_session* session, zerith_reply_callback callback, void* context) {
  return call(session, wire::kStartConfig, {}, callback, context);
}

int zerith_fetch_states(zerith_session* session, const char* user_info, zerith_reply_callback callback, void* context) {
  Value user;
  if (!session || !parseContainer(session, user_info, "user info", false, user)) {
    return -1;
  }
  return call(session, wire::kFetchStates, wire::fetchStatesArgs(user), callback, context);
}

int zerith_fetch_display_url(zerith_session* session, zerith_reply_callback callback, void* context) {
  return call(session, wire::kFetchDisplayURL, {}, callback, context);
}

int zerith_send_message(zerith_session* session, const char* message, zerith_reply_callback callback, void* context) {
  Value m;
  if (!session || !parseContainer(session, message, "message", false, m)) {
    return -1;
  }
  return call(session, wire::kSendMessage, wire::sendMessageArgs(m), callback, context);
}

int zerith_flush_messages(zerith_session* session, zerith_reply_callback callback, void* context) {
  return call(session, wire::kFlushMessages, {}, callback, context);
}

int zerith_finish_session(zerith_session* session) {
  return call(session, wire::kFinishSession, {}, nullptr, nullptr);
}

int zerith_upload_file(zerith_session* session, const char* file_url, const char* extension_token,
                       zerith_reply_callback callback, void* context) {
  if (!file_url) {
    return fail("a file URL is required");
  }
  return call(session, wire::kUploadFile, wire::uploadFileArgs(Value(file_url), extension_token ? Value(extension_token) : Value()),
              callback, context);
}

int zerith_upload_log_data(zerith_session* session, const char* log_data, zerith_reply_callback callback, void* context) {
  Value data;
  if (!session || !parseContainer(session, log_data, "log data", true, data)) {
    return -1;
  }
  return call(session, wire::kUploadLogData, wire::uploadLogDataArgs(data), callback, context);
}

int zerith_send_message_with_session_info(zerith_session* session, const char* session_info, const char* user_info,
                                          uint16_t category, uint16_t type, const char* payload,
                                          zerith_reply_callback callback, void* context) {
  Value info, user, p;
  if (!session || !parseContainer(session, session_info, "session info", false, info) ||
      !parseContainer(session, user_info, "user info", false, user) ||
      !parseContainer(session, payload, "payload", false, p)) {
    return -1;
  }
  return call(session, wire::kSendMessageWithSessionInfo,
              wire::sendMessageWithSessionInfoArgs(info, user, category, type, p),
              callback, context);
}

int zerith_update_shared_data(zerith_session* session, const char* dictionary) {
  Value d;
  if (!session || !parseContainer(session, dictionary, "dictionary", false, d)) {
    return -1;
  }
  return call(session, wire::kUpdateSharedData, wire::updateSharedDataArgs(d), nullptr, nullptr);
}

int zerith_update_shared_data_for_key(zerith_session* session, const char* key, const char* value) {
  Value v;
  if (!key) {
    return fail("a key is required");
  }
  if (!session || !parse(session, value, "value", v)) {
    return -1;
  }
  return call(session, wire::kUpdateSharedDataForKey, wire::updateSharedDataForKeyArgs(Value(key), v), nullptr, nullptr);
}

int zerith_set_digest_key(zerith_session* session, const void* key, size_t length, int32_t algorithm) {
  Value k;
  if (key) {
    const auto* bytes = static_cast<const std::uint8_t*>(key);
    k = Value(zerith::Data(bytes, bytes + length));
  }
  return call(session, wire::kSetDigestKey, wire::setDigestKeyArgs(k, algorithm), nullptr, nullptr);
}

char* zerith_framework_version(void) { return copyText(zerith::Zerith::frameworkVersion()); }

char* zerith_public_key_path(void) { return copyText(zerith::Zerith::publicKeyPath().string()); }

char* zerith_persistent_identifier_for_dnu(int dnu) {
  return copyText(zerith::Zerith::getPersistentIdentifierForDNU(dnu != 0));
}

}  // extern "C"
