#pragma once

// Test helpers shared by the end-to-end tests that feed generated traffic: the body of a
// catch-all pattern situation, and the application a page record counts under.

#include <string>

#include "tests/support/sm3_records.h"

namespace q7test {

// A PUT /api/v1/situations body: one pattern on Q7TXPTNS matching every page, keeping every
// application and transaction name apart, at the given threshold and instance level.
inline std::string CatchAllPatternBody(long thresholdMillis, int collectInstances) {
  return R"({"table": "Q7TXPTNS", "conditions": [
      {"column": "APPLICATIN", "value": "All"}, {"column": "APPPATTERN", "value": "*"},
      {"column": "TRANSACTN", "value": "All"}, {"column": "TRANSPATTN", "value": "*"},
      {"column": "AGGAPSUNIQ", "value": "1"}, {"column": "AGGTXSUNIQ", "value": "1"},
      {"column": "COLLINSTCS", "value": ")" +
         std::to_string(collectInstances) + R"("}, {"column": "MRTTHRES", "value": ")" +
         std::to_string(thresholdMillis) + R"("}]})";
}

// The application of a page under that pattern: the URL's host, or the server's address
// without one.
inline const std::string& ApplicationOf(const Record& page) {
  return page.text(kHost).empty() ? page.text(kServerAddress) : page.text(kHost);
}

}  // namespace q7test
