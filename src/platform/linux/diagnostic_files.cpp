#include "platform/linux/diagnostic_files.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

namespace vireo::linux_platform {

namespace {

bool fail(Error* error, int code) {
  if (error) *error = Error{kPosixErrorDomain, code, std::strerror(code)};
  return false;
}

bool isDirectory(const std::string& path) {
  struct stat st {};
  return ::stat(path.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
}

bool writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    ssize_t n = ::write(fd, text.data(), text.size());
    if (n < 0) {
      if (errno == EINTR) continue;
      return false;
    }
    text.remove_prefix(static_cast<std::size_t>(n));
  }
  return true;
}

}  // namespace

LinuxDiagnosticFiles::LinuxDiagnosticFiles(std::string logDirectory) : logDirectory_(std::move(logDirectory)) {}

std::string LinuxDiagnosticFiles::logDirectory() const { return logDirectory_; }

bool LinuxDiagnosticFiles::createDirectory(const std::string& path, unsigned mode, Error* error) {
  if (path.empty()) return fail(error, ENOENT);
  // Each prefix ending before a '/', then the whole path.
  for (std::size_t end = path.find('/', 1);; end = path.find('/', end + 1)) {
    std::string prefix = path.substr(0, end);
    if (!prefix.empty() && prefix.back() != '/' && ::mkdir(prefix.c_str(), static_cast<mode_t>(mode)) != 0) {
      int code = errno;
      if (code != EEXIST) return fail(error, code);
      if (!isDirectory(prefix)) return fail(error, ENOTDIR);
    }
    if (end == std::string::npos) break;
  }
  return true;
}

bool LinuxDiagnosticFiles::writeAtomically(const std::string& path, std::string_view text, Error* error) {
  auto slash = path.rfind('/');
  std::string directory = slash == std::string::npos ? std::string(".") : path.substr(0, slash);
  std::string base = slash == std::string::npos ? path : path.substr(slash + 1);
  if (base.empty()) return fail(error, EISDIR);
  std::string temporary = directory + "/." + base + ".XXXXXX";
  int fd = ::mkostemp(temporary.data(), O_CLOEXEC);
  if (fd < 0) return fail(error, errno);
  int code = 0;
  if (::fchmod(fd, 0644) != 0 || !writeAll(fd, text) || ::fsync(fd) != 0) code = errno;
  if (::close(fd) != 0 && code == 0) code = errno;
  if (code == 0 && ::rename(temporary.c_str(), path.c_str()) != 0) code = errno;
  if (code != 0) {
    ::unlink(temporary.c_str());
    return fail(error, code);
  }
  return true;
}

}  // namespace vireo::linux_platform
