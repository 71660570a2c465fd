#pragma once

// The data-event endpoints of the HTTP API:
//
//   GET /api/v1/events          {"events": [row, ...]} oldest first; ?limit=N keeps the last N
//   GET /api/v1/events/stream   server-sent events, one "data: row\n\n" per row pushed from now
//
// A row is a JSON object keyed by attribute name, text without its padding, as in table
// samples. Alert changes come among them as the alert book's objects ("kind": "raised" or
// "cleared"), named "event: alerts" in the stream. Each open stream holds one of the server's
// worker threads, so at most kMaxEventStreams are served at once; more are refused with 503.
//
// Thread safety: InstallEventRoutes and EndEventStreams run on the thread that starts and stops
// the server; the handlers run on its worker threads.

namespace httplib {
class Server;
}

namespace fw {

inline constexpr int kMaxEventStreams = 4;

// Adds the routes to *server; *server must outlive its listening.
void InstallEventRoutes(httplib::Server& server);

// Ends the open streams of *server and refuses new ones: each writes the end of its reply, and
// the call returns once they have (at most about a second, for clients that do not read). Call
// it before server.stop(), which otherwise waits forever for the streams' worker threads, and
// would cut a stream short of its end.
void EndEventStreams(httplib::Server& server);

}  // namespace fw
