#include "platform/logger.h"

#include <cstdio>
#include <string>

namespace vireo {

void logFormat(Logger& logger, LogScope scope, LogLevel level, const char* file, int line, const char* function,
               const char* format, ...) {
  char stack[512];
  va_list args;
  va_start(args, format);
  va_list copy;
  va_copy(copy, args);
  int n = std::vsnprintf(stack, sizeof stack, format, args);
  va_end(args);
  if (n < 0) {
    va_end(copy);
    return;
  }
  if (static_cast<size_t>(n) < sizeof stack) {
    va_end(copy);
    logger.write(scope, level, file, line, function, std::string_view(stack, static_cast<size_t>(n)));
    return;
  }
  std::string big(static_cast<size_t>(n) + 1, '\0');
  std::vsnprintf(big.data(), big.size(), format, copy);
  va_end(copy);
  big.resize(static_cast<size_t>(n));
  logger.write(scope, level, file, line, function, big);
}

const char* scopeName(LogScope scope) {
  switch (scope) {
    case LogScope::Server: return "reporting_server_verbose";
    case LogScope::Session: return "reporting_session_verbose";
    case LogScope::Driver: return "reporting_driver_verbose";
    case LogScope::DefaultLog: return "default";
  }
  return "default";
}

const char* scopeCategory(LogScope scope) {
  switch (scope) {
    case LogScope::Server: return "vrrs";
    case LogScope::Session: return "vrrr";
    case LogScope::Driver: return "vrrd";
    case LogScope::DefaultLog: return "default";
  }
  return "default";
}

}  // namespace vireo
