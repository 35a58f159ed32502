#include "platform/linux/key_file.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <charconv>
#include <cstring>
#include <fstream>
#include <sstream>

namespace vireo::linux_platform {

namespace {

std::string_view trim(std::string_view s) {
  auto b = s.find_first_not_of(" \t\r");
  if (b == std::string_view::npos) return {};
  auto e = s.find_last_not_of(" \t\r");
  return s.substr(b, e - b + 1);
}

bool iequals(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (size_t i = 0; i < a.size(); ++i) {
    char x = a[i], y = b[i];
    if (x >= 'A' && x <= 'Z') x = static_cast<char>(x - 'A' + 'a');
    if (y >= 'A' && y <= 'Z') y = static_cast<char>(y - 'A' + 'a');
    if (x != y) return false;
  }
  return true;
}

}  // namespace

KeyFile parseKeyFile(std::string_view text) {
  KeyFile out;
  while (!text.empty()) {
    auto nl = text.find('\n');
    auto line = trim(text.substr(0, nl));
    text = nl == std::string_view::npos ? std::string_view{} : text.substr(nl + 1);
    if (line.empty() || line.front() == '#') continue;
    auto eq = line.find('=');
    if (eq == std::string_view::npos) continue;
    auto key = trim(line.substr(0, eq));
    if (key.empty()) continue;
    out.insert_or_assign(std::string(key), std::string(trim(line.substr(eq + 1))));
  }
  return out;
}

std::optional<KeyFile> readKeyFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  std::ostringstream ss;
  ss << in.rdbuf();
  return parseKeyFile(ss.str());
}

bool writeKeyFile(const std::string& path, const KeyFile& entries, std::string* error) {
  std::string text;
  for (const auto& [k, v] : entries) text += k + "=" + v + "\n";
  std::string tmp = path + ".XXXXXX";
  int fd = mkstemp(tmp.data());
  if (fd < 0) {
    if (error) *error = std::string("cannot create ") + tmp + ": " + std::strerror(errno);
    return false;
  }
  fchmod(fd, 0644);
  const char* p = text.data();
  size_t left = text.size();
  while (left > 0) {
    ssize_t n = ::write(fd, p, left);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (error) *error = std::string("cannot write ") + tmp + ": " + std::strerror(errno);
      ::close(fd);
      ::unlink(tmp.c_str());
      return false;
    }
    p += n;
    left -= static_cast<size_t>(n);
  }
  if (::fsync(fd) != 0 || ::close(fd) != 0 || ::rename(tmp.c_str(), path.c_str()) != 0) {
    if (error) *error = std::string("cannot replace ") + path + ": " + std::strerror(errno);
    ::unlink(tmp.c_str());
    return false;
  }
  return true;
}

bool parseBoolean(std::string_view text) {
  text = trim(text);
  return iequals(text, "1") || iequals(text, "yes") || iequals(text, "true") || iequals(text, "on");
}

std::optional<long long> parseInteger(std::string_view text) {
  text = trim(text);
  if (!text.empty() && text.front() == '+') text.remove_prefix(1);
  long long v = 0;
  auto r = std::from_chars(text.data(), text.data() + text.size(), v);
  if (r.ec != std::errc() || r.ptr != text.data() + text.size() || text.empty()) return std::nullopt;
  return v;
}

std::vector<std::string> splitList(std::string_view text) {
  std::vector<std::string> out;
  while (true) {
    auto comma = text.find(',');
    auto item = trim(text.substr(0, comma));
    if (!item.empty()) out.emplace_back(item);
    if (comma == std::string_view::npos) break;
    text.remove_prefix(comma + 1);
  }
  return out;
}

}  // namespace vireo::linux_platform
