#include "ctl/defaults_command.h"

#include <nlohmann/json.hpp>

#include <filesystem>

#include "ctl/output.h"
#include "platform/linux/key_file.h"

namespace vireo::ctl {

int runDefaults(const std::string& suitePath, const std::vector<std::string>& args, bool asJson, std::FILE* out,
                std::FILE* err) {
  using json = nlohmann::ordered_json;
  std::vector<std::string> words;
  for (const auto& a : args) {
    if (a == "--json") asJson = true;
    else words.push_back(a);
  }
  auto usage = [&] {
    return usageError(err, asJson, "usage: vireoctl defaults read [KEY] | write KEY VALUE... | delete KEY",
                      "defaults");
  };
  auto print = [&](const json& j) {
    std::fprintf(out, "%s\n", j.dump(-1, ' ', false, json::error_handler_t::replace).c_str());
  };
  if (words.empty()) return usage();
  const std::string& verb = words[0];
  auto suite = linux_platform::readKeyFile(suitePath).value_or(linux_platform::KeyFile{});

  if (verb == "read") {
    if (words.size() > 2) return usage();
    if (words.size() == 1) {
      json all = json::object();
      for (const auto& [k, v] : suite) {
        all[k] = v;
        if (!asJson) std::fprintf(out, "%s=%s\n", k.c_str(), v.c_str());
      }
      if (asJson) print(all);
      return 0;
    }
    auto it = suite.find(words[1]);
    if (it == suite.end()) {
      printError(err, asJson, {"defaults", kDefaultsError, words[1] + " is not set in " + suitePath, {}, 0});
      return 1;
    }
    if (asJson) print(json{{"key", it->first}, {"value", it->second}});
    else std::fprintf(out, "%s\n", it->second.c_str());
    return 0;
  }
  json result;
  if (verb == "write") {
    if (words.size() < 3 || words[1].empty() || words[1].find_first_of("=#\n") != std::string::npos ||
        words[1].find_first_not_of(" \t") != 0 || words[1].find_last_not_of(" \t") != words[1].size() - 1)
      return usage();
    std::string value;
    for (size_t i = 2; i < words.size(); ++i) value += (i > 2 ? " " : "") + words[i];
    if (value.find('\n') != std::string::npos)
      return usageError(err, asJson, "a defaults value cannot hold a line break", "defaults");
    suite.insert_or_assign(words[1], value);
    result = json{{"key", words[1]}, {"value", value}};
  } else if (verb == "delete") {
    if (words.size() != 2) return usage();
    bool existed = suite.erase(words[1]) > 0;
    result = json{{"key", words[1]}, {"deleted", existed}};
    if (!existed) {  // nothing to change
      if (asJson) print(result);
      return 0;
    }
  } else {
    return usage();
  }
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(suitePath).parent_path(), ec);
  std::string error;
  if (!linux_platform::writeKeyFile(suitePath, suite, &error)) {
    printError(err, asJson, {"defaults", kDefaultsError, error, {}, 0});
    return 1;
  }
  if (asJson) print(result);
  return 0;
}

}  // namespace vireo::ctl
