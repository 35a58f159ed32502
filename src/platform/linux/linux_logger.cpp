#define SD_JOURNAL_SUPPRESS_LOCATION  // the caller's location is passed explicitly
#include "platform/linux/linux_logger.h"

#include <sys/stat.h>
#include <systemd/sd-journal.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "platform/linux/key_file.h"

namespace vireo::linux_platform {

namespace {

constexpr LogScope kVerboseScopes[] = {LogScope::Server, LogScope::Session, LogScope::Driver};

std::size_t scopeIndex(LogScope scope) { return static_cast<std::size_t>(scope); }

}  // namespace

LinuxLogger::LinuxLogger(std::string_view verboseList, Output output, int fd) : output_(output), fd_(fd) {
  for (const auto& item : splitList(verboseList)) {
    if (item == "all") {
      verbose_.fill(true);
      continue;
    }
    for (auto scope : kVerboseScopes) {
      if (item == scopeName(scope)) verbose_[scopeIndex(scope)] = true;
    }
  }
}

std::unique_ptr<LinuxLogger> LinuxLogger::fromEnvironment() {
  const char* list = std::getenv("VIREO_VERBOSE");
  const char* stream = std::getenv("JOURNAL_STREAM");
  Output output = journalStreamMatches(stream, STDERR_FILENO) ? Output::Journal : Output::Stream;
  return std::make_unique<LinuxLogger>(list ? list : "", output, STDERR_FILENO);
}

bool LinuxLogger::journalStreamMatches(const char* journalStream, int fd) {
  if (!journalStream || !*journalStream) return false;
  unsigned long long device = 0, inode = 0;
  char tail = 0;
  if (std::sscanf(journalStream, "%llu:%llu%c", &device, &inode, &tail) != 2) return false;
  struct stat st {};
  if (fstat(fd, &st) != 0) return false;
  return static_cast<unsigned long long>(st.st_dev) == device && static_cast<unsigned long long>(st.st_ino) == inode;
}

int LinuxLogger::syslogPriority(LogLevel level) {
  switch (level) {
    case LogLevel::Error: return 3;
    case LogLevel::Default: return 5;
    case LogLevel::Info: return 6;
    case LogLevel::Debug: return 7;
  }
  return 5;
}

std::string LinuxLogger::formatLine(LogLevel level, const char* file, int line, const char* function,
                                    std::string_view message) {
  std::string text = "<";
  text += static_cast<char>('0' + syslogPriority(level));  // a single digit, 0 to 7
  text += '>';
  text += file ? file : "";
  text += ':';
  text += std::to_string(line);
  text += ':';
  text += function ? function : "";
  text += ": ";
  text += message;
  text += '\n';
  return text;
}

bool LinuxLogger::verbose(LogScope scope) const {
  auto i = scopeIndex(scope);
  return i < verbose_.size() && verbose_[i];
}

void LinuxLogger::write(LogScope scope, LogLevel level, const char* file, int line, const char* function,
                        std::string_view message) {
  if (output_ == Output::Journal) {
    writeJournal(scope, level, file, line, function, message);
  } else {
    writeStream(formatLine(level, file, line, function, message));
  }
}

void LinuxLogger::writeJournal(LogScope scope, LogLevel level, const char* file, int line, const char* function,
                               std::string_view message) {
  std::string text = formatLine(level, file, line, function, message);
  text.erase(0, text.find('>') + 1);  // the journal has its own PRIORITY field
  text.pop_back();
  const char* category = scopeCategory(scope);
  int rc = sd_journal_send("MESSAGE=%s", text.c_str(), "PRIORITY=%d", syslogPriority(level), "CODE_FILE=%s",
                           file ? file : "", "CODE_LINE=%d", line, "CODE_FUNC=%s", function ? function : "",
                           "VIREO_SUBSYSTEM=com.orvane.vireo", "VIREO_CATEGORY=%s", category, nullptr);
  // The journal went away: keep the line on stderr rather than lose it.
  if (rc < 0) writeStream(formatLine(level, file, line, function, message));
}

void LinuxLogger::writeStream(const std::string& text) {
  // One write per entry: lines of different threads never interleave.
  const char* p = text.data();
  std::size_t left = text.size();
  while (left > 0) {
    ssize_t n = ::write(fd_, p, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      return;
    }
    p += n;
    left -= static_cast<std::size_t>(n);
  }
}

}  // namespace vireo::linux_platform
