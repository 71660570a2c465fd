#include "framework/alerts_api.h"

#include <httplib.h>

#include <nlohmann/json.hpp>
#include <string>

#include "framework/alert_book.h"
#include "framework/http_json.h"
#include "framework/sample_query.h"
#include "framework/status.h"

namespace fw {

void InstallAlertRoutes(httplib::Server& server, const AlertBook* book) {
  server.Get("/api/v1/alerts", [book](const httplib::Request& req, httplib::Response& res) {
    std::size_t limit = kDefaultAlertCapacity;
    if (req.get_param_value_count("limit") > 1) {
      ReplyError(res, 400, "limit given more than once");
      return;
    }
    if (req.has_param("limit")) {
      std::string error;
      if (ParseLimit(req.get_param_value("limit"), &limit, &error) != kOk) {
        ReplyError(res, 400, error);
        return;
      }
    }
    ReplyJson(res, 200,
              nlohmann::ordered_json{{"open", book->Open()}, {"recent", book->Recent(limit)}});
  });
}

}  // namespace fw
