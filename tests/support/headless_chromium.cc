#include "tests/support/headless_chromium.h"

#include <fcntl.h>
#include <poll.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <fstream>
#include <thread>

#include "tests/support/test_util.h"

extern char** environ;

namespace q7test {
namespace {

constexpr char kChromium[] = "/usr/bin/chromium";

std::string Base64Decode(const std::string& text) {
  static const std::string kAlphabet =
      "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
  std::string out;
  unsigned bits = 0;
  int count = 0;
  for (const char c : text) {
    const auto at = kAlphabet.find(c);
    if (at == std::string::npos) {
      continue;  // padding
    }
    bits = (bits << 6) | static_cast<unsigned>(at);
    count += 6;
    if (count >= 8) {
      count -= 8;
      out.push_back(static_cast<char>((bits >> count) & 0xff));
    }
  }
  return out;
}

// A pipe end moved above the descriptors the child's 3 and 4 will be, so that placing one
// never overwrites the other; close-on-exec, the child's copies excepted.
int HighDescriptor(int fd) {
  const int high = ::fcntl(fd, F_DUPFD_CLOEXEC, 10);
  ::close(fd);
  return high;
}

// The text of a console call's arguments.
std::string ConsoleText(const nlohmann::json& args) {
  std::string text;
  for (const auto& arg : args) {
    text += text.empty() ? "" : " ";
    if (arg.contains("value")) {
      text += arg["value"].is_string() ? arg["value"].get<std::string>() : arg["value"].dump();
    } else {
      text += arg.value("description", arg.value("type", ""));
    }
  }
  return text;
}

}  // namespace

std::string HeadlessChromium::Path() {
  return ::access(kChromium, X_OK) == 0 ? kChromium : "";
}

HeadlessChromium::HeadlessChromium(const std::string& profile_dir, const std::string& log_path,
                                   std::string* error) {
  ::signal(SIGPIPE, SIG_IGN);  // a browser that died must fail a write, not end the test
  int commands[2];
  int answers[2];
  if (::pipe2(commands, O_CLOEXEC) != 0 || ::pipe2(answers, O_CLOEXEC) != 0) {
    *error = std::string("pipe: ") + std::strerror(errno);
    return;
  }
  const int child_in = HighDescriptor(commands[0]);
  to_browser_ = HighDescriptor(commands[1]);
  from_browser_ = HighDescriptor(answers[0]);
  const int child_out = HighDescriptor(answers[1]);

  std::vector<std::string> args = {kChromium,
                                   "--headless",
                                   "--no-sandbox",
                                   "--disable-gpu",
                                   "--remote-debugging-pipe",
                                   "--user-data-dir=" + profile_dir,
                                   "--window-size=1280,900",
                                   "--no-first-run",
                                   "--disable-extensions",
                                   "--disable-background-networking",
                                   "--disable-dev-shm-usage",
                                   "about:blank"};
  std::vector<char*> argv;
  for (std::string& arg : args) {
    argv.push_back(arg.data());
  }
  argv.push_back(nullptr);
  posix_spawn_file_actions_t files;
  posix_spawn_file_actions_init(&files);
  posix_spawn_file_actions_addopen(&files, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
  posix_spawn_file_actions_addopen(&files, STDOUT_FILENO, log_path.c_str(),
                                   O_WRONLY | O_CREAT | O_TRUNC, 0644);
  posix_spawn_file_actions_adddup2(&files, STDOUT_FILENO, STDERR_FILENO);
  posix_spawn_file_actions_adddup2(&files, child_in, 3);
  posix_spawn_file_actions_adddup2(&files, child_out, 4);
  posix_spawnattr_t attr;
  posix_spawnattr_init(&attr);
  sigset_t none;
  sigemptyset(&none);
  sigset_t defaults;
  sigemptyset(&defaults);
  sigaddset(&defaults, SIGPIPE);
  sigaddset(&defaults, SIGTERM);
  posix_spawnattr_setsigmask(&attr, &none);
  posix_spawnattr_setsigdefault(&attr, &defaults);
  // A group of its own: its renderer and utility processes go with it at the end.
  posix_spawnattr_setpgroup(&attr, 0);
  posix_spawnattr_setflags(&attr,
                           POSIX_SPAWN_SETSIGMASK | POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETPGROUP);
  const int spawned = posix_spawn(&pid_, kChromium, &files, &attr, argv.data(), environ);
  posix_spawnattr_destroy(&attr);
  posix_spawn_file_actions_destroy(&files);
  ::close(child_in);
  ::close(child_out);
  if (spawned != 0) {
    pid_ = -1;
    *error = std::string("cannot run ") + kChromium + ": " + std::strerror(spawned);
    return;
  }

  // Its page: the one target of type "page" that about:blank opened. A failed call ends the
  // polling with *error set.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
  std::string page;
  bool failed = false;
  PollUntil(
      [&] {
        const int id = next_id_++;
        const auto targets = Send({{"id", id}, {"method", "Target.getTargets"}}, error)
                                 ? AwaitAnswer(id, deadline, error)
                                 : std::nullopt;
        if (!targets) {
          failed = true;
          return true;
        }
        for (const auto& target : (*targets)["targetInfos"]) {
          if (target.value("type", "") == "page") {
            page = target.value("targetId", "");
          }
        }
        return !page.empty();
      },
      std::chrono::seconds(15));
  if (failed) {
    return;
  }
  const int id = next_id_++;
  if (page.empty() || !Send({{"id", id},
                             {"method", "Target.attachToTarget"},
                             {"params", {{"targetId", page}, {"flatten", true}}}},
                            error)) {
    *error = page.empty() ? "the browser opened no page" : *error;
    return;
  }
  const auto attached = AwaitAnswer(id, deadline, error);
  if (!attached) {
    return;
  }
  session_ = attached->value("sessionId", "");
  for (const char* domain : {"Runtime.enable", "Log.enable", "Page.enable"}) {
    if (!Call(domain, nlohmann::json::object(), error)) {
      session_.clear();
      return;
    }
  }
}

HeadlessChromium::~HeadlessChromium() {
  if (pid_ > 0) {
    std::string ignored;
    const int id = next_id_++;
    if (Send({{"id", id}, {"method", "Browser.close"}}, &ignored)) {
      AwaitAnswer(id, std::chrono::steady_clock::now() + std::chrono::seconds(2), &ignored);
    }
    int status = 0;
    const bool exited = PollUntil([&] { return ::waitpid(pid_, &status, WNOHANG) == pid_; },
                                  std::chrono::seconds(5));
    if (!exited) {
      ::kill(-pid_, SIGKILL);
      ::waitpid(pid_, &status, 0);
    }
  }
  for (const int fd : {to_browser_, from_browser_}) {
    if (fd >= 0) {
      ::close(fd);
    }
  }
}

bool HeadlessChromium::Send(const nlohmann::json& message, std::string* error) {
  const std::string text = message.dump() + '\0';
  std::size_t sent = 0;
  while (sent < text.size()) {
    const ssize_t n = ::write(to_browser_, text.data() + sent, text.size() - sent);
    if (n < 0 && errno == EINTR) {
      continue;
    }
    if (n <= 0) {
      *error = std::string("the browser went away: ") + std::strerror(errno);
      return false;
    }
    sent += static_cast<std::size_t>(n);
  }
  return true;
}

std::optional<nlohmann::json> HeadlessChromium::AwaitAnswer(
    int id, std::chrono::steady_clock::time_point deadline, std::string* error) {
  for (;;) {
    if (const auto answer = answers_.find(id); answer != answers_.end()) {
      const nlohmann::json message = std::move(answer->second);
      answers_.erase(answer);
      if (message.contains("error")) {
        *error = message["error"].dump();
        return std::nullopt;
      }
      return message.value("result", nlohmann::json::object());
    }
    if (!ReadMessages(deadline, error)) {
      return std::nullopt;
    }
  }
}

bool HeadlessChromium::ReadMessages(std::chrono::steady_clock::time_point deadline,
                                    std::string* error) {
  const auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
      deadline - std::chrono::steady_clock::now());
  if (left.count() <= 0) {
    *error = "no answer from the browser in time";
    return false;
  }
  pollfd readable{from_browser_, POLLIN, 0};
  if (::poll(&readable, 1, static_cast<int>(left.count())) <= 0) {
    return true;  // the deadline is checked at the next call
  }
  char buffer[65536];
  const ssize_t n = ::read(from_browser_, buffer, sizeof(buffer));
  if (n < 0 && errno == EINTR) {
    return true;
  }
  if (n <= 0) {
    *error = "the browser closed its end of the pipe";
    return false;
  }
  pending_.append(buffer, static_cast<std::size_t>(n));
  for (auto end = pending_.find('\0'); end != std::string::npos; end = pending_.find('\0')) {
    auto message = nlohmann::json::parse(pending_.substr(0, end), nullptr, false);
    pending_.erase(0, end + 1);
    if (message.is_discarded()) {
      continue;
    }
    if (message.contains("id")) {
      const int id = message["id"].get<int>();
      answers_[id] = std::move(message);
    } else {
      NoteEvent(message);
    }
  }
  return true;
}

void HeadlessChromium::NoteEvent(const nlohmann::json& message) {
  const std::string method = message.value("method", "");
  const nlohmann::json params = message.value("params", nlohmann::json::object());
  if (method == "Runtime.consoleAPICalled") {
    const std::string type = params.value("type", "");
    if (type == "error" || type == "assert") {
      errors_.push_back("console." + type + ": " +
                        ConsoleText(params.value("args", nlohmann::json::array())));
    }
  } else if (method == "Runtime.exceptionThrown") {
    const auto details = params.value("exceptionDetails", nlohmann::json::object());
    const auto exception = details.value("exception", nlohmann::json::object());
    errors_.push_back("uncaught: " + exception.value("description", details.value("text", "")) +
                      " at " + details.value("url", "") + ":" +
                      std::to_string(details.value("lineNumber", -1) + 1));
  } else if (method == "Log.entryAdded") {
    const auto entry = params.value("entry", nlohmann::json::object());
    if (entry.value("level", "") == "error") {
      errors_.push_back(entry.value("source", "") + ": " + entry.value("text", "") + " " +
                        entry.value("url", ""));
    }
  } else if (method == "Page.loadEventFired") {
    ++load_events_;
  }
}

std::optional<nlohmann::json> HeadlessChromium::Call(const std::string& method,
                                                     const nlohmann::json& params,
                                                     std::string* error,
                                                     std::chrono::milliseconds timeout) {
  const int id = next_id_++;
  if (!Send({{"id", id}, {"method", method}, {"params", params}, {"sessionId", session_}}, error)) {
    return std::nullopt;
  }
  return AwaitAnswer(id, std::chrono::steady_clock::now() + timeout, error);
}

std::optional<nlohmann::json> HeadlessChromium::Evaluate(const std::string& expression,
                                                         std::string* error) {
  const auto answer =
      Call("Runtime.evaluate",
           {{"expression", expression}, {"returnByValue", true}, {"awaitPromise", true}}, error);
  if (!answer) {
    return std::nullopt;
  }
  if (answer->contains("exceptionDetails")) {
    *error = (*answer)["exceptionDetails"].dump();
    return std::nullopt;
  }
  return (*answer)["result"].value("value", nlohmann::json());
}

bool HeadlessChromium::WaitUntil(const std::string& expression, std::chrono::milliseconds timeout) {
  return PollUntil(
      [&] {
        std::string error;
        const auto value = Evaluate(expression, &error);
        return value && *value == true;
      },
      timeout);
}

bool HeadlessChromium::Navigate(const std::string& url, std::string* error) {
  const int loads = load_events_;
  const auto answer = Call("Page.navigate", {{"url", url}}, error);
  if (!answer) {
    return false;
  }
  if (answer->contains("errorText")) {
    *error = (*answer)["errorText"].get<std::string>();
    return false;
  }
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(15);
  while (load_events_ == loads) {
    if (!ReadMessages(deadline, error)) {
      *error = "no load event from " + url + ": " + *error;
      return false;
    }
  }
  return true;
}

bool HeadlessChromium::SetViewport(int width, int height, bool mobile, std::string* error) {
  return Call("Emulation.setDeviceMetricsOverride",
              {{"width", width}, {"height", height}, {"deviceScaleFactor", 1}, {"mobile", mobile}},
              error)
      .has_value();
}

bool HeadlessChromium::Click(double x, double y, std::string* error) {
  for (const char* type : {"mouseMoved", "mousePressed", "mouseReleased"}) {
    nlohmann::json params = {{"type", type}, {"x", x}, {"y", y}};
    if (std::strcmp(type, "mouseMoved") != 0) {
      params["button"] = "left";
      params["clickCount"] = 1;
    }
    if (!Call("Input.dispatchMouseEvent", params, error)) {
      return false;
    }
  }
  return true;
}

bool HeadlessChromium::Screenshot(const std::string& path, std::string* error) {
  const auto shot = Call("Page.captureScreenshot", {{"format", "png"}}, error);
  if (!shot) {
    return false;
  }
  std::ofstream(path, std::ios::binary | std::ios::trunc) << Base64Decode(shot->value("data", ""));
  return true;
}

}  // namespace q7test
