#include "tools/q7ctl/top.h"

#include <poll.h>
#include <signal.h>
#include <sys/ioctl.h>
#include <termios.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>
#include <csignal>
#include <ctime>
#include <iostream>
#include <map>
#include <sstream>
#include <vector>

#include "tools/q7ctl/readable.h"

namespace q7ctl {
namespace {

constexpr std::size_t kDefaultWidth = 120;
constexpr std::size_t kDefaultHeight = 40;
// Title, keys, a blank line and a caption, and between the sections a blank and a caption.
constexpr std::size_t kChromeLines = 7;

volatile std::sig_atomic_t g_stop = 0;

void OnStop(int) {
  g_stop = 1;
}
// Only interrupts the wait, so that the screen is drawn again at the new size.
void OnResize(int) {}

double Number(const Json& row, const char* key, double missing = -1) {
  const auto it = row.find(key);
  return it != row.end() && it->is_number() ? it->get<double>() : missing;
}

std::string Text(const Json& row, const char* key) {
  const auto it = row.find(key);
  return it != row.end() && it->is_string() ? it->get<std::string>() : std::string();
}

// Milliseconds as whole numbers; the sketches' decimals mean nothing at a glance.
Json Millis(const Json& row, const char* key) {
  const double value = Number(row, key);
  return value < 0 ? Json() : Json(std::llround(value));
}

Json Apdex(const Json& row) {
  const double value = Number(row, "apdex");
  return value < 0 ? Json() : Json(std::round(value * 100) / 100);
}

Json Percent(const Json& row, const char* key) {
  const double value = Number(row, key);
  return value < 0 ? Json() : Json(ReadablePercent(static_cast<long long>(value)));
}

// Busiest: most requests first. Slowest: highest p95 first, rows without one last.
void Order(std::vector<Json>* rows, bool slowest, const char* requests_key) {
  std::stable_sort(rows->begin(), rows->end(), [&](const Json& a, const Json& b) {
    if (slowest) {
      const double pa = Number(a, "p95_ms"), pb = Number(b, "p95_ms");
      if (pa != pb) {
        return pa > pb;
      }
    }
    return Number(a, requests_key, 0) > Number(b, requests_key, 0);
  });
}

Json ApplicationRows(const TopData& data, bool slowest, std::size_t limit) {
  std::map<std::string, Json> latency;
  for (const Json& row : data.application_latency) {
    latency.emplace(Text(row, "application"), row);
  }
  // The table's figures with the latency answer's merged in, under one name per application.
  std::vector<Json> merged;
  for (const Json& row : data.applications) {
    Json both = row;
    const auto it = latency.find(Text(row, "applicatin"));
    if (it != latency.end()) {
      both.update(it->second);
    }
    merged.push_back(std::move(both));
  }
  Order(&merged, slowest, "totreq");
  Json out = Json::array();
  for (std::size_t i = 0; i < merged.size() && i < limit; ++i) {
    const Json& row = merged[i];
    out.push_back(Json::object({{"application", Text(row, "applicatin")},
                                {"requests", Number(row, "totreq", 0)},
                                {"good", Percent(row, "pcgood")},
                                {"slow", Percent(row, "pcslow")},
                                {"failed", Percent(row, "pcfail")},
                                {"avail", Percent(row, "pcavail")},
                                {"avg_ms", Millis(row, "oatime")},
                                {"p50_ms", Millis(row, "p50_ms")},
                                {"p95_ms", Millis(row, "p95_ms")},
                                {"p99_ms", Millis(row, "p99_ms")},
                                {"apdex", Apdex(row)}}));
  }
  return out;
}

Json TransactionRows(const TopData& data, bool slowest, std::size_t limit) {
  std::vector<Json> rows(data.transaction_latency.begin(), data.transaction_latency.end());
  Order(&rows, slowest, "requests");
  Json out = Json::array();
  for (std::size_t i = 0; i < rows.size() && i < limit; ++i) {
    const Json& row = rows[i];
    out.push_back(Json::object({{"application", Text(row, "application")},
                                {"transaction", Text(row, "transaction")},
                                {"requests", Number(row, "requests", 0)},
                                {"p50_ms", Millis(row, "p50_ms")},
                                {"p95_ms", Millis(row, "p95_ms")},
                                {"p99_ms", Millis(row, "p99_ms")},
                                {"max_ms", Millis(row, "max_ms")},
                                {"apdex", Apdex(row)},
                                {"threshold_ms", Millis(row, "threshold_ms")}}));
  }
  return out;
}

// Requests counts are whole numbers; JSON would print 12.0.
void WholeRequests(Json* rows) {
  for (Json& row : *rows) {
    row["requests"] = std::llround(row["requests"].get<double>());
  }
}

std::string Section(const Json& rows, std::size_t width, const char* none) {
  if (rows.empty()) {
    return std::string("  (") + none + ")\n";
  }
  FormatOptions options;
  options.max_line = width;
  options.max_width = 32;
  std::ostringstream out;
  WriteRows(rows, options, out);
  return out.str();
}

std::string LocalTime() {
  const std::time_t now = std::time(nullptr);
  std::tm local{};
  localtime_r(&now, &local);
  char text[32];
  std::strftime(text, sizeof(text), "%Y-%m-%d %H:%M:%S", &local);
  return text;
}

void TerminalSize(std::size_t* width, std::size_t* height) {
  winsize size{};
  if (::ioctl(STDOUT_FILENO, TIOCGWINSZ, &size) == 0 && size.ws_col > 0 && size.ws_row > 0) {
    *width = size.ws_col;
    *height = size.ws_row;
  } else {
    *width = kDefaultWidth;
    *height = kDefaultHeight;
  }
}

// The terminal in the state top needs, restored when this goes out of scope: keys arrive one at
// a time without echo (signals still work), on the alternate screen with the cursor hidden.
class TerminalSession {
 public:
  TerminalSession() {
    raw_ = ::isatty(STDIN_FILENO) != 0 && ::tcgetattr(STDIN_FILENO, &saved_) == 0;
    if (raw_) {
      termios raw = saved_;
      raw.c_lflag &= ~static_cast<tcflag_t>(ICANON | ECHO);
      raw.c_cc[VMIN] = 0;
      raw.c_cc[VTIME] = 0;
      ::tcsetattr(STDIN_FILENO, TCSANOW, &raw);
    }
    std::cout << "\x1b[?1049h\x1b[?25l" << std::flush;
  }
  ~TerminalSession() {
    std::cout << "\x1b[?25h\x1b[?1049l" << std::flush;
    if (raw_) {
      ::tcsetattr(STDIN_FILENO, TCSANOW, &saved_);
    }
  }
  TerminalSession(const TerminalSession&) = delete;
  TerminalSession& operator=(const TerminalSession&) = delete;

 private:
  bool raw_ = false;
  termios saved_{};
};

// Installs the handlers for RunTop's duration; without SA_RESTART, so that poll returns.
class SignalScope {
 public:
  SignalScope() {
    Install(SIGINT, OnStop, &int_);
    Install(SIGTERM, OnStop, &term_);
    Install(SIGWINCH, OnResize, &winch_);
  }
  ~SignalScope() {
    ::sigaction(SIGINT, &int_, nullptr);
    ::sigaction(SIGTERM, &term_, nullptr);
    ::sigaction(SIGWINCH, &winch_, nullptr);
  }
  SignalScope(const SignalScope&) = delete;
  SignalScope& operator=(const SignalScope&) = delete;

 private:
  static void Install(int signal, void (*handler)(int), struct sigaction* saved) {
    struct sigaction action {};
    action.sa_handler = handler;
    sigemptyset(&action.sa_mask);
    ::sigaction(signal, &action, saved);
  }
  struct sigaction int_ {};
  struct sigaction term_ {};
  struct sigaction winch_ {};
};

// Waits up to timeout for a key; applies it to view. False when the operator asked to quit.
bool WaitForKey(int timeout_ms, TopView* view) {
  pollfd in{STDIN_FILENO, POLLIN, 0};
  if (::poll(&in, 1, timeout_ms) <= 0 || (in.revents & POLLIN) == 0) {
    return true;
  }
  char keys[16];
  const ssize_t got = ::read(STDIN_FILENO, keys, sizeof(keys));
  if (got == 0) {
    return false;  // end of input: nobody is left to press q
  }
  for (ssize_t i = 0; i < got; ++i) {
    switch (keys[i]) {
      case 'q':
      case 'Q':
        return false;
      case 'w':
      case 'W':
        view->summary = !view->summary;
        break;
      case 's':
      case 'S':
        view->slowest = !view->slowest;
        break;
      default:
        break;  // any other key refreshes at once
    }
  }
  return true;
}

}  // namespace

TopData FetchTop(ApiClient& client, const TopView& view) {
  TopData data;
  const std::string window = view.summary ? "summary" : "interval";
  const std::string table = view.summary ? "Q7APPSM" : "Q7APPCS";
  Json reply;
  Result result = client.Get(SampleTarget(table, {}, std::nullopt), &reply);
  if (result.ok()) {
    data.applications = reply.value("rows", Json::array());
    result = client.Get(LatencyTarget("application", window, {}), &reply);
  }
  if (result.ok()) {
    data.application_latency = reply.value("rows", Json::array());
    result = client.Get(LatencyTarget("transaction", window, {}), &reply);
  }
  if (result.ok()) {
    data.transaction_latency = reply.value("rows", Json::array());
  } else {
    data.error = result.message();
  }
  return data;
}

std::string RenderTop(const TopData& data, const TopView& view, const std::string& agent,
                      const std::string& now, std::size_t width, std::size_t height) {
  std::string screen = "q7ctl top  " + agent + "  " +
                       (view.summary ? "summary period" : "current interval") + "  " + now + "\n";
  screen += "keys: w interval/summary   s busiest/slowest   q quit\n\n";
  if (!data.error.empty()) {
    return screen + "cannot read the agent: " + data.error + "\n";
  }
  const std::size_t rows = height > kChromeLines + 2 ? (height - kChromeLines) / 2 - 1 : 1;
  const char* order = view.slowest ? "slowest first (p95)" : "busiest first (requests)";
  Json applications = ApplicationRows(data, view.slowest, rows);
  WholeRequests(&applications);
  Json transactions = TransactionRows(data, view.slowest, rows);
  WholeRequests(&transactions);
  screen += std::string("Applications, ") + order + "\n";
  screen += Section(applications, width, "no requests in this window");
  screen += std::string("\nTransactions, ") + order + "\n";
  screen += Section(transactions, width, "no requests in this window");
  return screen;
}

int RunTop(ApiClient& client, const std::string& agent, const TopOptions& options) {
  TopView view = options.view;
  if (options.once || ::isatty(STDOUT_FILENO) == 0) {
    const TopData data = FetchTop(client, view);
    std::cout << RenderTop(data, view, agent, LocalTime(), kDefaultWidth, kDefaultHeight);
    return data.error.empty() ? 0 : 1;
  }
  g_stop = 0;
  SignalScope signals;
  TerminalSession terminal;
  const int interval_ms = static_cast<int>(std::max(0.1, options.interval_seconds) * 1000);
  while (g_stop == 0) {
    std::size_t width = 0, height = 0;
    TerminalSize(&width, &height);
    const std::string screen =
        RenderTop(FetchTop(client, view), view, agent, LocalTime(), width, height);
    // Home, each line cleared to its end, the rest of the screen cleared: no flicker.
    std::string frame = "\x1b[H";
    std::size_t start = 0;
    for (std::size_t lines = 0; start < screen.size() && lines + 1 < height; ++lines) {
      std::size_t end = screen.find('\n', start);
      if (end == std::string::npos) {
        end = screen.size();
      }
      frame.append(screen, start, end - start).append("\x1b[K\r\n");
      start = end + 1;
    }
    frame += "\x1b[J";
    std::cout << frame << std::flush;
    if (!WaitForKey(interval_ms, &view)) {
      break;
    }
  }
  return 0;
}

}  // namespace q7ctl
