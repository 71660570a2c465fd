// The HTTP server's static files (the dashboard) and who may read them.

#include "framework/http_server.h"

#include <gtest/gtest.h>
#include <httplib.h>

#include <memory>
#include <string>

#include "framework/status.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

constexpr char kToken[] = "0123456789abcdef";

class StaticFilesTest : public ::testing::Test {
 protected:
  void SetUp() override {
    files_.write("index.html", "<!doctype html><title>q7</title>");
    files_.write("app.js", "export const x = 1;");
    files_.write("vendor/lib.js", "var lib;");
  }

  // Starts the server on host (port 0) with the token, serving dir.
  void Start(const std::string& host, const std::string& dir) {
    server_.SetApiToken(kToken);
    server_.ServeStatic(dir);
    std::string error;
    ASSERT_EQ(kOk, server_.Start(host + ":0", &error)) << error;
    const std::string& bound = server_.bound_address();
    client_ =
        std::make_unique<httplib::Client>("http://127.0.0.1" + bound.substr(bound.rfind(':')));
  }

  // The status of a GET, or of another method, with or without the token.
  int Status(const std::string& path, bool withToken = false, const std::string& method = "GET") {
    httplib::Headers headers;
    if (withToken) {
      headers.emplace("Authorization", std::string("Bearer ") + kToken);
    }
    const auto res = method == "GET"    ? client_->Get(path.c_str(), headers)
                     : method == "HEAD" ? client_->Head(path.c_str(), headers)
                                        : client_->Put(path.c_str(), headers, "{}", "text/plain");
    return res ? res->status : -1;
  }

  q7test::ScratchDir files_;
  HttpServer server_;
  std::unique_ptr<httplib::Client> client_;
};

// "/" answers index.html; files keep their types (a module must come as JavaScript); a path
// that is no file falls through to the API and its JSON 404.
TEST_F(StaticFilesTest, ServesIndexAndFilesWithTheirTypes) {
  Start("127.0.0.1", files_.path() + "/");
  auto res = client_->Get("/");
  ASSERT_TRUE(res);
  EXPECT_EQ(200, res->status);
  EXPECT_EQ("<!doctype html><title>q7</title>", res->body);
  EXPECT_EQ("text/html", res->get_header_value("Content-Type"));
  res = client_->Get("/vendor/lib.js");
  ASSERT_TRUE(res);
  EXPECT_EQ(200, res->status);
  EXPECT_EQ("text/javascript", res->get_header_value("Content-Type"));
  EXPECT_EQ("no-cache", res->get_header_value("Cache-Control"));

  res = client_->Get("/missing.js");
  ASSERT_TRUE(res);
  EXPECT_EQ(404, res->status);
  EXPECT_NE(std::string::npos, res->body.find("\"error\""));
  // Climbing out of the directory is refused, even to come back into it.
  EXPECT_EQ(404, Status("/../" + files_.path().substr(5) + "/app.js"));
  EXPECT_EQ(200, Status("/healthz"));
}

// Off loopback the files need no token, while the API, /metrics and /healthz still do, and
// nothing but GET and HEAD passes without it.
TEST_F(StaticFilesTest, FilesNeedNoTokenOffLoopbackButTheApiDoes) {
  Start("0.0.0.0", files_.path());
  EXPECT_EQ(200, Status("/"));
  EXPECT_EQ(200, Status("/app.js"));
  EXPECT_EQ(200, Status("/app.js", false, "HEAD"));
  EXPECT_EQ(404, Status("/nothing-here"));
  EXPECT_EQ(401, Status("/app.js", false, "PUT"));
  for (const char* path : {"/api/v1/tables", "/api/v1/events", "/metrics", "/healthz"}) {
    EXPECT_EQ(401, Status(path)) << path;
  }
  EXPECT_EQ(200, Status("/api/v1/tables", true));
  EXPECT_EQ(200, Status("/healthz", true));
}

// Without a directory to serve, the API runs alone and keeps every rule.
TEST_F(StaticFilesTest, MissingDirectoryServesTheApiOnly) {
  Start("0.0.0.0", files_.path() + "/absent/");
  EXPECT_EQ(401, Status("/"));
  EXPECT_EQ(404, Status("/", true));
  EXPECT_EQ(200, Status("/healthz", true));
}

}  // namespace
}  // namespace fw
