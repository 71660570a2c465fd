#pragma once

// Rows of `q7ctl alerts`: the agent's open alerts and alert changes (GET /api/v1/alerts, and the
// changes that reach the events stream) as people read them: the key as "column=value" words,
// times as local dates and times. raw keeps the agent's epoch seconds.
//
// Thread safety: pure functions.

#include "tools/q7ctl/format.h"

namespace q7ctl {

// One row per open alert: situation, severity, key, since (the raise), seen (the last sample
// that matched).
Json OpenAlertRows(const Json& open, bool raw);

// One row per change: sequence, at, kind, situation, severity, key.
Json AlertChangeRows(const Json& changes, bool raw);

// True for an event of the events stream that is an alert change rather than a table row.
bool IsAlertChange(const Json& event);

}  // namespace q7ctl
