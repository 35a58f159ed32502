// The logger of the daemon: the journal when stderr is connected to it, otherwise
// one "<priority>file:line:function: message" line per entry on stderr.
#pragma once

#include <unistd.h>

#include <array>
#include <memory>
#include <string>
#include <string_view>

#include "platform/logger.h"

namespace vireo::linux_platform {

class LinuxLogger : public Logger {
 public:
  enum class Output { Stream, Journal };

  // verboseList is the VIREO_VERBOSE text: scope names separated by commas, or "all".
  // Stream output goes to fd, which the logger does not own.
  LinuxLogger(std::string_view verboseList, Output output, int fd = STDERR_FILENO);
  // Reads VIREO_VERBOSE and JOURNAL_STREAM.
  static std::unique_ptr<LinuxLogger> fromEnvironment();

  bool verbose(LogScope scope) const override;
  void write(LogScope scope, LogLevel level, const char* file, int line, const char* function,
             std::string_view message) override;

  // True when journalStream ("device:inode") names the file open on fd.
  static bool journalStreamMatches(const char* journalStream, int fd);
  // One stream line, ending in a newline.
  static std::string formatLine(LogLevel level, const char* file, int line, const char* function,
                                std::string_view message);
  static int syslogPriority(LogLevel level);

 private:
  void writeJournal(LogScope scope, LogLevel level, const char* file, int line, const char* function,
                    std::string_view message);
  void writeStream(const std::string& text);

  std::array<bool, 4> verbose_{};  // by LogScope; fixed at construction
  const Output output_;
  const int fd_;
};

}  // namespace vireo::linux_platform
