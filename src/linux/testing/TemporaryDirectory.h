// TemporaryDirectory: a fresh directory that goes, with all that is in it, when the test ends.

#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>
#include <string_view>

namespace tessel::testing {

class TemporaryDirectory {
 public:
  TemporaryDirectory() {
    if (::mkdtemp(path_.data()) == nullptr) throw std::runtime_error("mkdtemp");
  }
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }
  std::string path(std::string_view name) const { return path_ + "/" + std::string(name); }
  // Writes a file in place.
  void write(std::string_view name, std::string_view text) const {
    std::ofstream(path(name), std::ios::binary | std::ios::trunc) << text;
  }

 private:
  std::string path_ = (std::filesystem::temp_directory_path() / "tessel-test-XXXXXX").string();
};

}  // namespace tessel::testing
