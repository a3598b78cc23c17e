// A directory that goes away with the object, and files in it.
#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <stdexcept>
#include <string>

namespace orv::test {

// All that a file holds, "" where there is none.
inline std::string content_of(const std::string& path) {
  std::ostringstream text;
  text << std::ifstream(path, std::ios::binary).rdbuf();
  return text.str();
}

class TemporaryDirectory {
 public:
  explicit TemporaryDirectory(const std::string& parent = std::filesystem::temp_directory_path())
      : path_(parent + "/orv-test-XXXXXX") {
    if (mkdtemp(path_.data()) == nullptr) throw std::runtime_error("mkdtemp");
  }
  ~TemporaryDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TemporaryDirectory(const TemporaryDirectory&) = delete;
  TemporaryDirectory& operator=(const TemporaryDirectory&) = delete;

  [[nodiscard]] const std::string& path() const noexcept { return path_; }
  [[nodiscard]] std::string file(const std::string& name) const { return path_ + "/" + name; }

  // The path of the file, with this text in place of any other.
  [[nodiscard]] std::string write(const std::string& name, const std::string& text) const {
    std::ofstream(file(name), std::ios::binary) << text;
    return file(name);
  }

  [[nodiscard]] std::string read(const std::string& name) const { return content_of(file(name)); }

 private:
  std::string path_;
};

}  // namespace orv::test
