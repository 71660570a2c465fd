#pragma once

// Test helper: Debian's headless Chromium driven over the DevTools protocol on a pipe
// (--remote-debugging-pipe: JSON messages ended by NUL on file descriptors 3 and 4), attached
// to its one page. It keeps what the page reported as a failure: console errors, uncaught
// exceptions and resources that failed to load.
//
// Closed (and its processes reaped) when destroyed. Not thread-safe.

#include <sys/types.h>

#include <chrono>
#include <map>
#include <nlohmann/json.hpp>
#include <optional>
#include <string>
#include <vector>

namespace q7test {

class HeadlessChromium {
 public:
  // The browser Debian installs; empty when it is not installed.
  static std::string Path();

  // Starts the browser with its profile in profile_dir (a directory of the test's own) and its
  // output in log_path, and attaches to its page. started() tells whether that worked; *error
  // says why not.
  HeadlessChromium(const std::string& profile_dir, const std::string& log_path, std::string* error);
  ~HeadlessChromium();
  HeadlessChromium(const HeadlessChromium&) = delete;
  HeadlessChromium& operator=(const HeadlessChromium&) = delete;

  bool started() const { return !session_.empty(); }

  // Sends a command to the page and waits for its answer: the result, or nullopt with the
  // protocol's error (or a timeout) in *error.
  std::optional<nlohmann::json> Call(const std::string& method, const nlohmann::json& params,
                                     std::string* error,
                                     std::chrono::milliseconds timeout = std::chrono::seconds(10));

  // Evaluates a JavaScript expression in the page, awaiting a promise; its value as JSON, or
  // nullopt with the exception in *error.
  std::optional<nlohmann::json> Evaluate(const std::string& expression, std::string* error);

  // Polls expression every 50 ms until it yields true or the timeout passes.
  bool WaitUntil(const std::string& expression, std::chrono::milliseconds timeout);

  // Loads url and waits for its load event.
  bool Navigate(const std::string& url, std::string* error);
  // The viewport in CSS pixels, as a phone (touch, viewport meta) when mobile.
  bool SetViewport(int width, int height, bool mobile, std::string* error);
  // A left click at viewport coordinates, as a mouse makes it.
  bool Click(double x, double y, std::string* error);
  // Writes a PNG of the viewport to path.
  bool Screenshot(const std::string& path, std::string* error);

  // What the page reported as failures so far, one line each.
  const std::vector<std::string>& errors() const { return errors_; }

 private:
  // Reads messages until the answer to `id` comes or the deadline passes.
  std::optional<nlohmann::json> AwaitAnswer(int id, std::chrono::steady_clock::time_point deadline,
                                            std::string* error);
  // Waits for what the browser sends (until the deadline at most) and takes in every complete
  // message: answers are kept for AwaitAnswer, events noted. False when the deadline has passed
  // or the browser is gone.
  bool ReadMessages(std::chrono::steady_clock::time_point deadline, std::string* error);
  void NoteEvent(const nlohmann::json& message);
  bool Send(const nlohmann::json& message, std::string* error);

  pid_t pid_ = -1;
  int to_browser_ = -1;                    // its descriptor 3
  int from_browser_ = -1;                  // its descriptor 4
  std::string pending_;                    // bytes read after the last complete message
  std::map<int, nlohmann::json> answers_;  // by command id, until AwaitAnswer takes them
  int load_events_ = 0;                    // the page's load events so far
  std::string session_;                    // the page's session, empty until attached
  int next_id_ = 1;
  std::vector<std::string> errors_;
};

}  // namespace q7test
