#pragma once

// Test helpers shared by the support files: reading a whole file and polling a condition.
// Header-only.

#include <chrono>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>

namespace q7test {

// The whole file; empty when it cannot be read.
inline std::string FileText(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

// Polls done() every 10 ms until it holds (true) or the timeout passes (false).
template <typename Condition>
bool PollUntil(Condition done, std::chrono::milliseconds timeout) {
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!done()) {
    if (std::chrono::steady_clock::now() >= deadline) {
      return false;
    }
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return true;
}

}  // namespace q7test
