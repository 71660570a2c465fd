#pragma once

// Test helper: a scratch directory from mkdtemp("/tmp/q7test_XXXXXX"): no '.' or
// '-' in its path, which would upset the order of collector files kept there;
// removed with its contents on destruction. Header-only so every test binary can use it.

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>

namespace q7test {

class ScratchDir {
 public:
  ScratchDir() {
    char tmpl[] = "/tmp/q7test_XXXXXX";
    if (::mkdtemp(tmpl) == nullptr) {
      throw std::runtime_error("mkdtemp failed");
    }
    path_ = tmpl;
  }
  ~ScratchDir() {
    std::error_code ec;
    std::filesystem::remove_all(path_, ec);
  }
  ScratchDir(const ScratchDir&) = delete;
  ScratchDir& operator=(const ScratchDir&) = delete;

  // The directory, without a trailing '/'.
  const std::string& path() const { return path_; }
  // path() + "/" + relative.
  std::string file(const std::string& relative) const { return path_ + "/" + relative; }
  // Writes bytes to a file below the directory, creating its parents.
  void write(const std::string& relative, const std::string& bytes) const {
    const std::filesystem::path p = file(relative);
    std::filesystem::create_directories(p.parent_path());
    std::ofstream(p, std::ios::binary) << bytes;
  }
  // The whole file; empty when it cannot be read.
  std::string read(const std::string& relative) const {
    std::ifstream in(file(relative), std::ios::binary);
    return std::string(std::istreambuf_iterator<char>(in), {});
  }

 private:
  std::string path_;
};

}  // namespace q7test
