// The message log's append rate: every append lists the folder and dates the
// log files in it, then appends one line. Measured with only the current
// file in the folder and with 99 other files beside it.
//
// Each append also writes its "Saved log message" line to the system log;
// run with standard error sent to /dev/null so the terminal is not measured.

#include <benchmark/benchmark.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "config/MessageLog.h"
#include "platform/Paths.h"
#include "platform/Value.h"

namespace {

using namespace zerith;
namespace fs = std::filesystem;

void BM_MessageLogAppend(benchmark::State& state) {
  std::string folder = (fs::temp_directory_path() / "message-log-bench-XXXXXX").string();
  if (::mkdtemp(folder.data()) == nullptr) {
    state.SkipWithError("mkdtemp failed");
    return;
  }
  const double now = Date::now().secondsSince1970;
  const MessageLog log({folder, [now] { return now; }, {}});
  log.write("first line");  // the current file
  const auto others = state.range(0) - 1;
  for (std::int64_t i = 0; i < others; ++i) {
    // Half are log-file look-alikes that are not log files, half other
    // diagnostics: each is listed, the look-alikes are also name-checked.
    const std::string name = i % 2 ? "other_" + std::to_string(i) + "_messageLog.diag"
                                   : "diagnostics-" + std::to_string(i) + ".log";
    std::ofstream(fs::path(folder) / name) << "x\n";
  }
  const std::string message =
      "[httpsPost -> sendMessageWithDictionary] {\"_sender\":\"YJ\",\"_method\":12,\"_status\":3}";
  for (auto _ : state) {
    log.write(message);
  }
  state.SetItemsProcessed(state.iterations());
  std::error_code ec;
  fs::remove_all(folder, ec);
}
BENCHMARK(BM_MessageLogAppend)->ArgName("files")->Arg(1)->Arg(100)->UseRealTime();

}  // namespace
