// A temporary directory for one test, removed with everything in it afterwards.
#pragma once

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

namespace vireo::testing {

class TempDir {
 public:
  TempDir() {
    std::string pattern = (std::filesystem::temp_directory_path() / "vireo-test-XXXXXX").string();
    if (::mkdtemp(pattern.data())) path_ = pattern;
  }
  ~TempDir() {
    std::error_code ignored;
    if (!path_.empty()) std::filesystem::remove_all(path_, ignored);
  }
  TempDir(const TempDir&) = delete;
  TempDir& operator=(const TempDir&) = delete;

  const std::string& path() const { return path_; }
  std::string sub(const std::string& name) const { return path_ + "/" + name; }
  // Writes text to the file name below the directory, making its parents.
  void write(const std::string& name, const std::string& text) const {
    std::filesystem::create_directories(std::filesystem::path(sub(name)).parent_path());
    std::ofstream(sub(name), std::ios::binary | std::ios::trunc) << text;
  }

 private:
  std::string path_;
};

}  // namespace vireo::testing
