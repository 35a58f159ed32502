// The configuration directory's key files: the input is the text of a defaults suite
// (or device.conf, telemetry.conf, analytics.conf, which share the format).
//
// Checked beyond not crashing: the parsed entries are well formed, the suite store
// answers exactly what the parser read, and writing the entries back and reading them
// again gives the same entries.
#include <cstdint>
#include <string>
#include <string_view>

#include "fuzz_support.h"
#include "platform/linux/defaults_store.h"
#include "platform/linux/key_file.h"

namespace vireo::fuzz {
namespace {

using namespace vireo::linux_platform;

bool isTrimmed(std::string_view s) {
  auto blank = [](char c) { return c == ' ' || c == '\t' || c == '\r'; };
  return s.empty() || (!blank(s.front()) && !blank(s.back()));
}

void checkEntries(const KeyFile& file) {
  for (const auto& [key, value] : file) {
    FUZZ_CHECK(!key.empty());
    FUZZ_CHECK(isTrimmed(key) && isTrimmed(value));
    FUZZ_CHECK(key.front() != '#');
    FUZZ_CHECK(key.find('=') == std::string::npos);
    FUZZ_CHECK(key.find('\n') == std::string::npos && value.find('\n') == std::string::npos);
  }
}

void checkValueParsers(std::string_view value) {
  for (const std::string& item : splitList(value)) {
    FUZZ_CHECK(!item.empty() && isTrimmed(item));
    FUZZ_CHECK(item.find(',') == std::string::npos);
  }
  if (auto n = parseInteger(value)) FUZZ_CHECK(parseInteger(std::to_string(*n)) == n);
  (void)parseBoolean(value);
}

}  // namespace
}  // namespace vireo::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace vireo::fuzz;
  using namespace vireo::linux_platform;
  const std::string_view text(reinterpret_cast<const char*>(data), size);

  const KeyFile parsed = parseKeyFile(text);
  checkEntries(parsed);
  for (const auto& [key, value] : parsed) checkValueParsers(value);

  // The suite file as the daemon finds it in its configuration directory.
  const std::string& directory = scratchDirectory();
  SuiteFileDefaultsStore store(directory);
  const std::string path = store.suitePath("com.example.fuzz");
  FUZZ_CHECK(path == directory + "/com.example.fuzz.conf");
  FUZZ_CHECK(writeFile(path, text));

  auto read = readKeyFile(path);
  FUZZ_CHECK(read && *read == parsed);
  // The store reads the file again for every question: a few keys are enough.
  int asked = 0;
  for (const auto& [key, value] : parsed) {
    if (++asked > 4) break;
    FUZZ_CHECK(store.stringForKey("com.example.fuzz", key) == value);
    FUZZ_CHECK(store.boolForKey("com.example.fuzz", key) == parseBoolean(value));
  }
  FUZZ_CHECK(!store.stringForKey("com.example.fuzz", "") && !store.stringForKey("absent", "x"));
  // Suite names are file names; anything that could leave the directory is refused.
  const std::string suite(text.substr(0, text.find('\n')).substr(0, 32));
  const std::string suiteFile = store.suitePath(suite);
  const bool refused = suite.empty() || suite.find('/') != std::string::npos || suite == "." || suite == "..";
  FUZZ_CHECK(suiteFile.empty() == refused);
  if (!refused) FUZZ_CHECK(suiteFile == directory + "/" + suite + ".conf");

  // vireoctl defaults write: the entries survive the atomic rewrite.
  const std::string copy = directory + "/written.conf";
  std::string error;
  FUZZ_CHECK(writeKeyFile(copy, parsed, &error));
  auto again = readKeyFile(copy);
  FUZZ_CHECK(again && *again == parsed);
  return 0;
}
