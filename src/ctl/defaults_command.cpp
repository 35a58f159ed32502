#include "ctl/defaults_command.h"

#include <nlohmann/json.hpp>

#include <filesystem>

#include "platform/linux/key_file.h"

namespace vireo::ctl {

int runDefaults(const std::string& suitePath, const std::vector<std::string>& args, bool asJson, std::FILE* out,
                std::FILE* err) {
  using nlohmann::json;
  std::vector<std::string> words;
  for (const auto& a : args) {
    if (a == "--json") asJson = true;
    else words.push_back(a);
  }
  auto usage = [&] {
    std::fprintf(err, "usage: vireoctl defaults read [KEY] | write KEY VALUE | delete KEY\n");
    return 2;
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
      if (asJson) std::fprintf(out, "%s\n", all.dump(2).c_str());
      return 0;
    }
    auto it = suite.find(words[1]);
    if (it == suite.end()) {
      std::fprintf(err, "vireoctl: defaults: %s is not set in %s\n", words[1].c_str(), suitePath.c_str());
      return 1;
    }
    if (asJson) std::fprintf(out, "%s\n", json{{"key", it->first}, {"value", it->second}}.dump().c_str());
    else std::fprintf(out, "%s\n", it->second.c_str());
    return 0;
  }
  if (verb == "write") {
    if (words.size() < 3 || words[1].empty() || words[1].find('=') != std::string::npos) return usage();
    std::string value;
    for (size_t i = 2; i < words.size(); ++i) value += (i > 2 ? " " : "") + words[i];
    if (value.find('\n') != std::string::npos) {
      std::fprintf(err, "vireoctl: defaults: a value cannot hold a line break\n");
      return 2;
    }
    suite.insert_or_assign(words[1], value);
  } else if (verb == "delete") {
    if (words.size() != 2) return usage();
    if (suite.erase(words[1]) == 0) return 0;  // nothing to delete
  } else {
    return usage();
  }
  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(suitePath).parent_path(), ec);
  std::string error;
  if (!linux_platform::writeKeyFile(suitePath, suite, &error)) {
    std::fprintf(err, "vireoctl: defaults: %s\n", error.c_str());
    return 1;
  }
  return 0;
}

}  // namespace vireo::ctl
