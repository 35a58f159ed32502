// Logging facility: three named scopes with a verbose switch each, four levels.
#pragma once

#include <cstdarg>
#include <string_view>

namespace vireo {

// The component scopes; DefaultLog is the platform's default log, used by lines
// that are written outside any scope.
enum class LogScope { Server, Session, Driver, DefaultLog };
enum class LogLevel { Default, Info, Error, Debug };

class Logger {
 public:
  virtual ~Logger() = default;
  // True when the scope is at verbose level 5: its debug lines are written.
  virtual bool verbose(LogScope scope) const = 0;
  // file is the source file's base name, function the method's label.
  virtual void write(LogScope scope, LogLevel level, const char* file, int line, const char* function,
                     std::string_view message) = 0;
};

// printf-style formatting into Logger::write.
void logFormat(Logger& logger, LogScope scope, LogLevel level, const char* file, int line, const char* function,
               const char* format, ...) __attribute__((format(printf, 7, 8)));

const char* scopeName(LogScope scope);     // "reporting_server_verbose", ...
const char* scopeCategory(LogScope scope); // "vrrs", "vrrr", "vrrd", "default"

}  // namespace vireo

// VR_LOG(logger, scope, level, label, fmt, ...): label is the method's label as logged.
#define VR_LOG(logger, scope, level, label, ...) \
  ::vireo::logFormat((logger), (scope), (level), __FILE_NAME__, __LINE__, (label), __VA_ARGS__)
// Debug lines are written only when their scope is verbose; arguments are not evaluated otherwise.
#define VR_DEBUG(logger, scope, label, ...)                                                          \
  do {                                                                                              \
    if ((logger).verbose(scope))                                                                    \
      ::vireo::logFormat((logger), (scope), ::vireo::LogLevel::Debug, __FILE_NAME__, __LINE__, (label), \
                         __VA_ARGS__);                                                              \
  } while (0)
