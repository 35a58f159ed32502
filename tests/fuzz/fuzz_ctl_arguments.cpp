// vireoctl's words. The input is read the two ways vireoctl gets words: as script
// lines (splitLine, then one operation per line) and as a command line (one word per
// input line, operations separated by "--", or a store query).
//
// Checked beyond not crashing: numbers are within the bounds asked for and print back
// to themselves, a store query's SQL binds only the parameters it was given, and the
// time parser agrees with the number parser on plain numbers.
#include <cmath>
#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "ctl/arguments.h"
#include "ctl/store_query.h"
#include "fuzz_support.h"

namespace vireo::fuzz {
namespace {

using namespace vireo::ctl;

void checkWord(const std::string& word) {
  if (auto i = parseInt64(word)) FUZZ_CHECK(parseInt64(std::to_string(*i)) == i);
  for (std::uint64_t max : {std::uint64_t{UINT16_MAX}, std::uint64_t{UINT32_MAX}, std::uint64_t{UINT64_MAX}}) {
    if (auto u = parseUInt(word, max)) {
      FUZZ_CHECK(*u <= max);
      FUZZ_CHECK(parseUInt(std::to_string(*u), max) == u);
    }
  }
  auto d = parseDouble(word);
  auto t = parseTime(word);
  // A plain number is Unix seconds.
  if (d) FUZZ_CHECK(t && (*t == *d || (std::isnan(*t) && std::isnan(*d))));
  (void)parseTypedValue(word).text();
  Dictionary entries;
  const bool parsed = parseEntry(word, entries);
  FUZZ_CHECK(parsed == (!word.empty() && word.front() != '=' && word.find('=') != std::string::npos));
  FUZZ_CHECK(entries.size() == (parsed ? 1u : 0u));
}

void checkOperation(const std::vector<std::string>& words) {
  std::string error;
  auto op = parseOperation(words, &error);
  if (!op) {
    FUZZ_CHECK(!error.empty());
    return;
  }
  if (op->addressing != Addressing::To) FUZZ_CHECK(op->to.empty());
}

void checkStoreQuery(const std::vector<std::string>& words) {
  if (words.empty() || !isStoreCommand(words[0])) return;
  std::string error;
  auto q = parseStoreQuery(words[0], std::vector<std::string>(words.begin() + 1, words.end()), &error);
  if (!q) {
    FUZZ_CHECK(!error.empty());
    return;
  }
  FUZZ_CHECK(!q->limit || *q->limit >= 0);
  const std::string sql = storeSql(*q);
  // Parameters are bound only when present; the SQL must not name the others.
  const bool present[] = {q->name.has_value(), q->session.has_value(), q->since.has_value(), q->until.has_value(),
                          q->limit.has_value()};
  for (int i = 0; i < 5; ++i) FUZZ_CHECK((sql.find("?" + std::to_string(i + 1)) != std::string::npos) == present[i]);
}

}  // namespace
}  // namespace vireo::fuzz

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using namespace vireo::fuzz;
  using namespace vireo::ctl;
  const std::string_view text(reinterpret_cast<const char*>(data), size);

  std::vector<std::string> lines;
  for (std::string_view rest = text;;) {
    auto nl = rest.find('\n');
    lines.emplace_back(rest.substr(0, nl));
    if (nl == std::string_view::npos) break;
    rest.remove_prefix(nl + 1);
  }

  // Script mode: one operation per line.
  for (const std::string& line : lines) {
    std::string error;
    auto words = splitLine(line, &error);
    if (!words) {
      FUZZ_CHECK(!error.empty());
      continue;
    }
    for (const std::string& w : *words) {
      checkWord(w);
      FUZZ_CHECK(!w.empty() || line.find_first_of("'\"") != std::string::npos);
    }
    if (!words->empty()) checkOperation(*words);
  }

  // Command-line mode: the lines are the words.
  for (const auto& operation : splitSequence(lines)) {
    FUZZ_CHECK(!operation.empty());
    for (const std::string& w : operation) FUZZ_CHECK(w != "--");
    checkOperation(operation);
  }
  checkStoreQuery(lines);
  for (const std::string& w : lines)
    if (!w.empty()) checkWord(w);
  return 0;
}
