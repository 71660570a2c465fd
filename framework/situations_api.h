#pragma once

// The situation endpoints of the HTTP API:
//   GET    /api/v1/situations          the started situations, in the order started
//   PUT    /api/v1/situations/{NAME}   start (or replace) one: {"table": ..., "conditions":
//                                      [{"column": ..., "op": "EQ", "value": ...}, ...]}; on a
//                                      row table also "every", "for", "severity", "webhook"
//                                      (alerts; see situations.h)
//   DELETE /api/v1/situations/{NAME}   stop it
//
// Thread safety: the handlers run on the server's pool threads; the situation functions
// serialise starts and stops.

namespace httplib {
class Server;
}

namespace fw {

void InstallSituationRoutes(httplib::Server& server);

}  // namespace fw
