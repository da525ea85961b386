// A directory of the host's that goes away with the test, for volumes of
// the host firmware.
#pragma once

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

namespace nimbtest {

class TempDir {
 public:
  TempDir() {
    char pattern[] = "/tmp/nimb-test-XXXXXX";
    path_ = mkdtemp(pattern);
  }
  ~TempDir() { std::filesystem::remove_all(path_); }
  TempDir(const TempDir &) = delete;
  TempDir &operator=(const TempDir &) = delete;

  const std::string &path() const { return path_; }
  // Writes a file, with the directories it needs; `name` is relative.
  void File(const std::string &name, const std::string &content) const {
    std::filesystem::path file = std::filesystem::path(path_) / name;
    std::filesystem::create_directories(file.parent_path());
    std::ofstream(file, std::ios::binary) << content;
  }
  void File(const std::string &name, const std::vector<uint8_t> &bytes) const {
    File(name, std::string(bytes.begin(), bytes.end()));
  }
  void Directory(const std::string &name) const {
    std::filesystem::create_directories(std::filesystem::path(path_) / name);
  }

 private:
  std::string path_;
};

}  // namespace nimbtest
