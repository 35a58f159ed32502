// How vireoctl reports a failure: one line of text on standard error, or with
// --json one JSON object on standard error, so that standard output carries
// only results in either mode.
#pragma once

#include <cstdio>
#include <string>

namespace vireo::ctl {

struct ErrorReport {
  std::string op;       // the command or operation word; empty when there is none
  std::string name;     // a D-Bus error name, or com.orvane.vireoctl.* for vireoctl's own
  std::string message;
  std::string domain;   // with code: the client library's error domain, when it has one
  long code = 0;
};

inline constexpr const char* kUsageError = "com.orvane.vireoctl.UsageError";
inline constexpr const char* kStoreError = "com.orvane.vireoctl.StoreError";
inline constexpr const char* kDefaultsError = "com.orvane.vireoctl.DefaultsError";
inline constexpr const char* kForwarderError = "com.orvane.vireoctl.ForwarderError";

// Text: "vireoctl: OP: NAME: MESSAGE" (usage errors: "vireoctl: MESSAGE" and a hint).
// JSON: {"op":OP,"error":{"name":NAME,"message":MESSAGE[,"domain":D,"code":C]}}.
void printError(std::FILE* err, bool json, const ErrorReport& e);
// Prints a usage error and returns exit status 2.
int usageError(std::FILE* err, bool json, const std::string& message, const std::string& op = {});

}  // namespace vireo::ctl
