#include "platform/Log.h"

#include <algorithm>
#include <condition_variable>
#include <cstdlib>
#include <mutex>

#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <string>

#include <spdlog/sinks/base_sink.h>
#include <spdlog/sinks/dist_sink.h>
#include <spdlog/sinks/stdout_sinks.h>

namespace zerith::log {

namespace {

Level toLevel(spdlog::level::level_enum l) {
  switch (l) {
    case spdlog::level::err:
    case spdlog::level::critical: return Level::Error;
    case spdlog::level::debug:
    case spdlog::level::trace: return Level::Debug;
    default: return Level::Default;
  }
}

// Standard error when the service manager connected it to the journal: one
// line per message, led by the syslog priority in angle brackets, which the
// journal takes as the entry's priority and strips. The journal adds its own
// time stamp and the unit's identifier. A message of several lines repeats
// the priority on each, so that no part of it is logged at another level.
class JournalStreamSink final : public spdlog::sinks::base_sink<std::mutex> {
 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override {
    const std::string prefix =
        "<" + std::to_string(journalPriority(toLevel(msg.level))) + ">" +
        std::string(msg.logger_name.begin(), msg.logger_name.end()) + ": ";
    std::string out;
    out.reserve(prefix.size() + msg.payload.size() + 1);
    out += prefix;
    for (const char c : msg.payload) {
      out += c;
      if (c == '\n') {
        out += prefix;
      }
    }
    out += '\n';
    // One write per message keeps lines of different threads apart.
    std::size_t done = 0;
    while (done < out.size()) {
      const ssize_t n = ::write(STDERR_FILENO, out.data() + done, out.size() - done);
      if (n < 0 && errno == EINTR) {
        continue;
      }
      if (n <= 0) {
        return;
      }
      done += static_cast<std::size_t>(n);
    }
  }
  void flush_() override {}
};

// True when JOURNAL_STREAM ("<device>:<inode>") names the file behind our
// standard error. A child that inherited the variable but writes elsewhere
// does not match.
bool stderrIsJournal() {
  const char* env = std::getenv("JOURNAL_STREAM");
  if (!env || !*env) {
    return false;
  }
  unsigned long long device = 0;
  unsigned long long inode = 0;
  char tail = 0;
  if (std::sscanf(env, "%llu:%llu%c", &device, &inode, &tail) != 2) {
    return false;
  }
  struct stat st {};
  if (::fstat(STDERR_FILENO, &st) != 0) {
    return false;
  }
  return static_cast<unsigned long long>(st.st_dev) == device && static_cast<unsigned long long>(st.st_ino) == inode;
}

// The process's sinks. Owned here because spdlog's registry is process-wide
// by nature; every Logger shares it.
struct Sinks {
  std::shared_ptr<spdlog::sinks::dist_sink_mt> dist = std::make_shared<spdlog::sinks::dist_sink_mt>();
  std::shared_ptr<spdlog::sinks::sink> output;
  std::mutex mutex;
  bool debug = false;
  int captures = 0;

  Sinks() {
    output = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    output->set_level(spdlog::level::info);
    dist->add_sink(output);
  }

  void applyLevel() {
    const auto level = (debug || captures > 0) ? spdlog::level::debug : spdlog::level::info;
    spdlog::apply_all([level](const std::shared_ptr<spdlog::logger>& l) { l->set_level(level); });
  }

  static Sinks& get() {
    static Sinks* sinks = new Sinks();  // never destroyed: loggers may log during exit
    return *sinks;
  }
};

}  // namespace

int journalPriority(Level level) {
  switch (level) {
    case Level::Error: return 3;  // LOG_ERR
    case Level::Debug: return 7;  // LOG_DEBUG
    case Level::Default: break;
  }
  return 6;  // LOG_INFO
}

struct LogCapture::Sink : spdlog::sinks::base_sink<std::mutex> {
  mutable std::mutex linesMutex;
  mutable std::condition_variable arrived;
  std::vector<CapturedLine> captured;

 protected:
  void sink_it_(const spdlog::details::log_msg& msg) override {
    CapturedLine line{toLevel(msg.level), std::string(msg.logger_name.begin(), msg.logger_name.end()),
                      std::string(msg.payload.begin(), msg.payload.end())};
    {
      std::lock_guard lock(linesMutex);
      captured.push_back(std::move(line));
    }
    arrived.notify_all();
  }
  void flush_() override {}
};

void configure(const Options& options) {
  auto& s = Sinks::get();
  std::lock_guard lock(s.mutex);
  const bool journal = options.journal.value_or(stderrIsJournal());
  s.dist->remove_sink(s.output);
  if (journal) {
    s.output = std::make_shared<JournalStreamSink>();
  } else {
    s.output = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    s.output->set_pattern("%Y-%m-%d %H:%M:%S.%f %n[%l] %v");
  }
  s.output->set_level(options.debug ? spdlog::level::debug : spdlog::level::info);
  s.dist->add_sink(s.output);
  s.debug = options.debug;
  s.applyLevel();
}

Logger::Logger(const std::string& subsystem) {
  auto& s = Sinks::get();
  std::lock_guard lock(s.mutex);
  logger_ = spdlog::get(subsystem);
  if (!logger_) {
    logger_ = std::make_shared<spdlog::logger>(subsystem, s.dist);
    logger_->set_level((s.debug || s.captures > 0) ? spdlog::level::debug : spdlog::level::info);
    logger_->flush_on(spdlog::level::info);
    spdlog::register_logger(logger_);
  }
}

LogCapture::LogCapture() : sink_(std::make_shared<Sink>()) {
  auto& s = Sinks::get();
  std::lock_guard lock(s.mutex);
  sink_->set_level(spdlog::level::debug);
  s.dist->add_sink(sink_);
  ++s.captures;
  s.applyLevel();
}

LogCapture::~LogCapture() {
  auto& s = Sinks::get();
  std::lock_guard lock(s.mutex);
  s.dist->remove_sink(sink_);
  --s.captures;
  s.applyLevel();
}

std::vector<CapturedLine> LogCapture::lines() const {
  std::lock_guard lock(sink_->linesMutex);
  return sink_->captured;
}

std::size_t LogCapture::count(std::string_view needle) const {
  std::lock_guard lock(sink_->linesMutex);
  return static_cast<std::size_t>(std::count_if(sink_->captured.begin(), sink_->captured.end(),
                                                [&](const CapturedLine& l) { return l.text.find(needle) != std::string::npos; }));
}

bool LogCapture::has(Level level, std::string_view text) const {
  std::lock_guard lock(sink_->linesMutex);
  return std::any_of(sink_->captured.begin(), sink_->captured.end(),
                     [&](const CapturedLine& l) { return l.level == level && l.text == text; });
}

bool LogCapture::waitFor(std::string_view needle, std::chrono::milliseconds timeout) const {
  std::unique_lock lock(sink_->linesMutex);
  return sink_->arrived.wait_for(lock, timeout, [&] {
    return std::any_of(sink_->captured.begin(), sink_->captured.end(),
                       [&](const CapturedLine& l) { return l.text.find(needle) != std::string::npos; });
  });
}

void LogCapture::clear() {
  std::lock_guard lock(sink_->linesMutex);
  sink_->captured.clear();
}

std::string escaped(std::string_view text) {
  std::string out;
  out.reserve(text.size());
  for (const char ch : text) {
    const auto c = static_cast<unsigned char>(ch);
    switch (ch) {
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (c < 0x20 || c == 0x7f) {
          out += fmt::format("\\x{:02x}", c);
        } else {
          out.push_back(ch);
        }
    }
  }
  return out;
}

}  // namespace zerith::log
