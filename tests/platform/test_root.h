#pragma once
// A fresh device root per test: a temporary folder that SE_DEVICE_ROOT
// points at, with dev/ and sys/nfc/ made, removed again at the end.
#include <stdlib.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

namespace se_test {

class TestRoot {
 public:
  TestRoot() {
    char tmpl[] = "/tmp/simtest.XXXXXX";
    const char* dir = mkdtemp(tmpl);
    path_ = dir ? dir : "";
    setenv("SE_DEVICE_ROOT", path_.c_str(), 1);
    makeDir("dev");
    makeDir("sys/nfc");
  }
  ~TestRoot() {
    std::error_code ec;
    if (!path_.empty()) std::filesystem::remove_all(path_, ec);
  }
  TestRoot(const TestRoot&) = delete;
  TestRoot& operator=(const TestRoot&) = delete;

  const std::string& path() const { return path_; }
  std::string at(const std::string& rel) const { return path_ + "/" + rel; }

  void makeDir(const std::string& rel) {
    std::error_code ec;
    std::filesystem::create_directories(at(rel), ec);
  }
  void writeFile(const std::string& rel, const std::string& content) {
    std::ofstream(at(rel), std::ios::trunc) << content;
  }
  void appendFile(const std::string& rel, const std::string& content) {
    std::ofstream(at(rel), std::ios::app) << content;
  }
  // nullptr removes the node.
  void writeNode(const std::string& rel, const char* content) {
    if (content == nullptr) {
      unlink(at(rel).c_str());
    } else {
      writeFile(rel, content);
    }
  }

 private:
  std::string path_;
};

}  // namespace se_test
