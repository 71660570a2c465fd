#pragma once

// `q7ctl top`: a live view of the busiest (or slowest) applications and transactions, refreshed
// in the terminal like top(1). Each refresh is three API calls: the applications table of the
// window (Q7APPCS for the current interval, Q7APPSM for the summary period) and the latency
// answers by application and by transaction.
//
// Rendering is a pure function of the replies, so tests can check a screen without a terminal;
// RunTop owns the terminal (raw keys, alternate screen) and restores it however it ends.
//
// Thread safety: single-threaded; RunTop installs SIGINT/SIGTERM/SIGWINCH handlers for its
// duration.

#include <cstddef>
#include <string>

#include "tools/q7ctl/client.h"
#include "tools/q7ctl/format.h"

namespace q7ctl {

// What the operator has chosen with the keys.
struct TopView {
  bool summary = false;  // w: current interval or summary period
  bool slowest = false;  // s: busiest (requests) or slowest (p95) first
};

// One refresh's replies, or why it failed.
struct TopData {
  Json applications = Json::array();         // rows of Q7APPCS or Q7APPSM
  Json application_latency = Json::array();  // /api/v1/latency?by=application rows
  Json transaction_latency = Json::array();  // /api/v1/latency?by=transaction rows
  std::string error;                         // empty when all three answered
};

// Reads the three answers for the view's window.
TopData FetchTop(ApiClient& client, const TopView& view);

// The screen: a title line (agent, window, local time, keys), the applications and the
// transactions, each ordered as the view says and cut to what fits width x height.
std::string RenderTop(const TopData& data, const TopView& view, const std::string& agent,
                      const std::string& now, std::size_t width, std::size_t height);

struct TopOptions {
  TopView view;
  double interval_seconds = 2;
  // One screen printed plainly, then exit: also what happens when stdout is not a terminal.
  bool once = false;
};

// The live view until 'q', Ctrl-C or SIGTERM; returns q7ctl's exit status (1 when --once could
// not reach the agent).
int RunTop(ApiClient& client, const std::string& agent, const TopOptions& options);

}  // namespace q7ctl
