#pragma once

// The alert endpoint of the HTTP API:
//
//   GET /api/v1/alerts   {"open": [...], "recent": [...]}: the open alerts, oldest raise first,
//                        and the last changes, oldest first (?limit=N keeps the last N of
//                        them, default and at most 1000). Changes also reach the events stream.
//
// Thread safety: the handler runs on the server's worker threads and only reads the book.

namespace httplib {
class Server;
}

namespace fw {

class AlertBook;

// book must outlive the server.
void InstallAlertRoutes(httplib::Server& server, const AlertBook* book);

}  // namespace fw
