#include "ctl/output.h"

#include <nlohmann/json.hpp>

namespace vireo::ctl {

void printError(std::FILE* err, bool json, const ErrorReport& e) {
  if (json) {
    nlohmann::ordered_json error{{"name", e.name}, {"message", e.message}};
    if (!e.domain.empty()) {
      error["domain"] = e.domain;
      error["code"] = e.code;
    }
    nlohmann::ordered_json line = nlohmann::ordered_json::object();
    if (!e.op.empty()) line["op"] = e.op;
    line["error"] = std::move(error);
    std::fprintf(err, "%s\n", line.dump(-1, ' ', false, nlohmann::json::error_handler_t::replace).c_str());
  } else if (e.name == kUsageError) {
    std::fprintf(err, "vireoctl: %s\n(see vireoctl --help)\n", e.message.c_str());
  } else if (e.name.rfind("com.orvane.vireoctl.", 0) == 0) {
    std::fprintf(err, "vireoctl: %s%s%s\n", e.op.c_str(), e.op.empty() ? "" : ": ", e.message.c_str());
  } else {
    std::fprintf(err, "vireoctl: %s%s%s: %s\n", e.op.c_str(), e.op.empty() ? "" : ": ", e.name.c_str(),
                 e.message.c_str());
  }
  std::fflush(err);
}

int usageError(std::FILE* err, bool json, const std::string& message, const std::string& op) {
  printError(err, json, {op, kUsageError, message, {}, 0});
  return 2;
}

}  // namespace vireo::ctl
