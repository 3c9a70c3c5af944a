// Feeds one input to every reader of operator-written files: as the device
// file and as a defaults domain (through the files, as the daemon reads
// them, every setting's value checked against its table row), and as the text of os-release, machine-id, a locale name and a
// message log name. Also replayed over its corpus by the config tests.

#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <span>
#include <string>
#include <string_view>

#include "config/ClientTypes.h"
#include "config/DeviceInfo.h"
#include "config/Identifiers.h"
#include "config/MessageLog.h"
#include "platform/Defaults.h"
#include "platform/DefaultsKeys.h"
#include "platform/Paths.h"
#include "platform/PropertyList.h"

namespace {

// A fresh inode each time (write, then rename over), so no cached parse of
// an earlier input answers; no fsync, which would make fuzzing crawl.
void replaceFile(const std::filesystem::path& path, std::string_view contents) {
  std::filesystem::create_directories(path.parent_path());
  const auto temporary = path.string() + ".new";
  std::ofstream(temporary, std::ios::binary | std::ios::trunc).write(contents.data(),
                                                                   static_cast<std::streamsize>(contents.size()));
  std::filesystem::rename(temporary, path);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // Every path under a scratch root of this process, removed at its exit.
  static std::string folder = (std::filesystem::temp_directory_path() / "device-file-fuzz-XXXXXX").string();
  if (::mkdtemp(folder.data()) == nullptr) {
    std::abort();
  }
  zerith::paths::setRoot(folder);
  std::atexit([] {
    std::error_code ignored;
    std::filesystem::remove_all(folder, ignored);
  });
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace zerith;
  const std::span<const std::uint8_t> bytes(data, size);
  const std::string_view text(reinterpret_cast<const char*>(data), size);

  // In memory: the device file's parser.
  if (auto facts = device::parseDeviceFile(bytes)) {
    (void)facts->description();
  }

  // Through the files, as the daemon reads them.
  replaceFile(paths::deviceFile(), text);
  (void)deviceProductVersion();
  (void)deviceInformationValue(kDeviceKeyReleaseType);

  const Defaults domain(kZerithDefaultsDomain);
  replaceFile(domain.path(), text);
  (void)userDefaultsEnvironment();
  (void)defaultsStringForKey("httpsPostURL");
  // Every setting's value through the parse its readers use, as
  // zerith-defaults check and the daemon's start run it.
  (void)defaultsDomainProblems(kZerithDomain);

  // The text files.
  (void)device::parseOsRelease(text);
  (void)device::uniqueDeviceIDFromMachineID(text);
  (void)device::countryFromLocale(text);
  (void)creationDateFromLogFileName(text);
  return 0;
}
