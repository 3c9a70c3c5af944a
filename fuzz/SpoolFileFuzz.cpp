// libFuzzer target: bytes found in the spool folder, which anything with
// write access to it (or a crash, or another version of the daemon) may have
// left there. Read as a header, as a whole file and through the store (the
// daemon's path: index at open, read before a retry). Beyond not crashing:
// a file that decodes encodes back to the same bytes, and the store either
// reads it or moves it aside, never both and never neither.
// (The backends tests replay the corpus through spoolFileFuzzOneInput.)

#include <unistd.h>

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <span>
#include <string>

#include "backends/Spool.h"

#ifndef ZERITH_FUZZ_ENTRY_NAME
#define ZERITH_FUZZ_ENTRY_NAME LLVMFuzzerTestOneInput
#endif

namespace {

// One folder per process, removed when the process exits (a crash leaves it
// behind, with the spool files it was reading). The path is never destroyed,
// so that it outlives the exit handler that removes the folder.
const std::filesystem::path& scratchFolder() {
  static const std::filesystem::path* const folder = [] {
    std::string tmpl = (std::filesystem::temp_directory_path() / "zerith-spool-fuzz-XXXXXX").string();
    if (!::mkdtemp(tmpl.data())) {
      std::abort();
    }
    return new std::filesystem::path(tmpl);
  }();
  static const int removedAtExit = std::atexit([] {
    std::error_code ec;
    std::filesystem::remove_all(*folder, ec);
  });
  (void)removedAtExit;
  return *folder;
}

}  // namespace

extern "C" int ZERITH_FUZZ_ENTRY_NAME(const std::uint8_t* data, std::size_t size) {
  using namespace zerith;
  const std::span<const std::uint8_t> bytes(data, size);

  const auto header = decodeSpoolHeader(bytes, nullptr);
  const auto batch = decodeSpoolFile(bytes, nullptr);
  if (batch) {
    if (!header || header->recordCount != batch->recordCount || header->createdMillis != batch->createdMillis) {
      std::abort();
    }
    const Data again = encodeSpoolFile(*batch);
    if (again.size() != size || !std::equal(again.begin(), again.end(), data)) {
      std::abort();
    }
  }

  // Through the store, as the daemon meets it.
  const std::filesystem::path folder = scratchFolder() / "spool";
  std::error_code ec;
  std::filesystem::remove_all(folder, ec);
  std::filesystem::create_directories(folder, ec);
  const std::string name = "0000000000000001-00000000.zspool";
  std::ofstream(folder / name, std::ios::binary).write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
  SpoolStore store(folder, 1ull << 30, 1ll << 40);
  store.clock = [] { return std::int64_t{0}; };
  std::string why;
  if (!store.open(&why)) {
    std::abort();
  }
  const bool indexed = store.size() == 1;
  const bool read = indexed && store.read(name).has_value();
  const bool aside = std::filesystem::exists(store.badFolder() / name, ec);
  if (read == aside || read != batch.has_value()) {
    std::abort();
  }
  return 0;
}
