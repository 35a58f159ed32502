// Small helpers shared by the fuzz targets: a failed property check aborts with a
// message (libFuzzer then saves the input), and a scratch directory per process.
#pragma once

#include <stdlib.h>
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <string_view>

namespace vireo::fuzz {

[[noreturn]] inline void fail(const char* what, const char* file, int line) {
  std::fprintf(stderr, "%s:%d: property violated: %s\n", file, line, what);
  std::abort();
}

#define FUZZ_CHECK(condition) ((condition) ? (void)0 : ::vireo::fuzz::fail(#condition, __FILE__, __LINE__))

// A directory that lives as long as the process. Files are rewritten for every input,
// so it goes on tmpfs when there is one: /tmp may be a disk, and writeKeyFile fsyncs.
inline const std::string& scratchDirectory() {
  static const std::string path = [] {
    std::string base;
    if (const char* t = std::getenv("TMPDIR"); t && *t) {
      base = t;
    } else {
      struct stat st {};
      base = ::stat("/dev/shm", &st) == 0 && S_ISDIR(st.st_mode) ? "/dev/shm" : "/tmp";
    }
    std::string pattern = base + "/vireo-fuzz-XXXXXX";
    if (!::mkdtemp(pattern.data())) fail("mkdtemp of a scratch directory", __FILE__, __LINE__);
    // Removed at exit, also when libFuzzer ends the run with exit().
    static const std::string removeAtExit = pattern;
    std::atexit([] {
      std::error_code ignored;
      std::filesystem::remove_all(removeAtExit, ignored);
    });
    return pattern;
  }();
  return path;
}

// VIREO_FUZZ_TRACE=1 makes a target say what it built from an input, for reading a
// reproducer or checking what a seed exercises.
inline bool tracing() {
  static const bool on = [] {
    const char* t = std::getenv("VIREO_FUZZ_TRACE");
    return t && *t && *t != '0';
  }();
  return on;
}

inline bool writeFile(const std::string& path, std::string_view text) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(text.data(), static_cast<std::streamsize>(text.size()));
  return static_cast<bool>(out);
}

inline std::string readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>());
}

}  // namespace vireo::fuzz
