#include "tools/q7ctl/client.h"

#include <httplib.h>

#include <chrono>
#include <string_view>
#include <utility>

namespace q7ctl {
namespace {

// A local agent answers at once; these only keep a wedged one from hanging the operator.
constexpr time_t kConnectTimeoutSeconds = 5;
constexpr time_t kReadTimeoutSeconds = 30;
// An event stream may stay quiet for as long as nothing happens on the agent.
constexpr auto kStreamReadTimeout = std::chrono::hours(24 * 365);

std::string Describe(httplib::Error error) {
  switch (error) {
    case httplib::Error::Connection:
      return "connection refused or host unreachable";
    case httplib::Error::ConnectionTimeout:
      return "connection timed out";
    case httplib::Error::Read:
      return "no complete reply (the connection was closed or timed out)";
    default:
      return httplib::to_string(error);
  }
}

Result ConnectionError(const std::string& url, httplib::Error error) {
  if (error == httplib::Error::SSLServerVerification) {
    return Result::Error("the agent at " + url +
                         " has a certificate that is not trusted here: give --cacert with the CA "
                         "(or self-signed certificate) that signed it, or set Q7_TLS_CACERT");
  }
  if (error == httplib::Error::SSLConnection) {
    return Result::Error("no TLS connection to the agent at " + url +
                         ": is it serving plain HTTP? (--url http://... then)");
  }
  return Result::Error("cannot reach the agent at " + url + ": " + Describe(error) +
                       " (is q7agent running there? --url selects another address)");
}

// "<error> (HTTP <status>)": the agent's {"error": ...} text, else the body's first line.
Result HttpError(int status, const std::string& body) {
  std::string text;
  const Json reply = Json::parse(body, nullptr, false);
  if (reply.is_object() && reply.contains("error") && reply["error"].is_string()) {
    text = reply["error"].get<std::string>();
  } else {
    text = body.substr(0, body.find_first_of("\r\n"));
  }
  if (text.empty()) {
    text = status == 401 ? "not authorized" : "request failed";
  }
  if (status == 401) {
    text += "; give the API token with --token or in the agent's q7_api_token";
  }
  return Result::Error(text + " (HTTP " + std::to_string(status) + ")");
}

Result Finish(const std::string& url, httplib::Result&& result, Json* reply) {
  if (!result) {
    return ConnectionError(url, result.error());
  }
  if (result->status < 200 || result->status >= 300) {
    return HttpError(result->status, result->body);
  }
  if (result->body.empty()) {
    *reply = nullptr;
    return Result::Ok();
  }
  *reply = Json::parse(result->body, nullptr, false);
  if (reply->is_discarded()) {
    return Result::Error("the agent at " + url + " sent a reply that is not JSON");
  }
  return Result::Ok();
}

bool IsUnreserved(unsigned char c) {
  return (c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-' ||
         c == '.' || c == '_' || c == '~';
}

// http://host:port or https://host:port, nothing after: cpp-httplib throws on other schemes
// and would quietly take a path as part of the host.
Result BadUrl(const std::string& url) {
  return Result::Error("\"" + url + "\" is not a URL of the form http://host:port");
}

bool IsAgentUrl(const std::string& url) {
  for (const std::string_view scheme : {"http://", "https://"}) {
    if (url.rfind(scheme, 0) == 0) {
      const std::string_view rest = std::string_view(url).substr(scheme.size());
      return !rest.empty() && rest.find_first_of("/?#") == std::string_view::npos;
    }
  }
  return false;
}

}  // namespace

std::string UrlEncode(const std::string& text) {
  static constexpr char kHex[] = "0123456789ABCDEF";
  std::string out;
  for (const char ch : text) {
    const auto c = static_cast<unsigned char>(ch);
    if (IsUnreserved(c)) {
      out += ch;
    } else {
      out += '%';
      out += kHex[c >> 4];
      out += kHex[c & 0x0F];
    }
  }
  return out;
}

std::string SampleTarget(const std::string& table, const std::vector<std::string>& wheres,
                         std::optional<long> limit) {
  std::string target = "/api/v1/tables/" + UrlEncode(table);
  char separator = '?';
  for (const std::string& where : wheres) {
    target += separator;
    target += "where=" + UrlEncode(where);
    separator = '&';
  }
  if (limit.has_value()) {
    target += separator;
    target += "limit=" + std::to_string(*limit);
  }
  return target;
}

std::string LatencyTarget(const std::string& by, const std::string& window,
                          const std::vector<std::string>& wheres) {
  std::string target = "/api/v1/latency?by=" + UrlEncode(by) + "&window=" + UrlEncode(window);
  for (const std::string& where : wheres) {
    target += "&where=" + UrlEncode(where);
  }
  return target;
}

std::string SituationTarget(const std::string& name) {
  return "/api/v1/situations/" + UrlEncode(name);
}

bool ParseCondition(const std::string& word, Json* condition, std::string* error) {
  const std::size_t eq = word.find('=');
  if (eq == std::string::npos) {
    *error = "\"" + word + "\" is not COLUMN=VALUE";
    return false;
  }
  if (eq == 0) {
    *error = "\"" + word + "\" names no column (expected COLUMN=VALUE)";
    return false;
  }
  *condition = Json::object();
  (*condition)["column"] = word.substr(0, eq);
  (*condition)["op"] = "EQ";
  (*condition)["value"] = word.substr(eq + 1);
  return true;
}

Json SituationBody(const std::string& table, const Json& conditions) {
  Json body = Json::object();
  body["table"] = table;
  body["conditions"] = conditions;
  return body;
}

std::vector<std::string> SseParser::Feed(const std::string& chunk) {
  std::vector<std::string> events;
  pending_ += chunk;
  std::size_t start = 0;
  for (std::size_t end; (end = pending_.find('\n', start)) != std::string::npos; start = end + 1) {
    std::string_view line(pending_.data() + start, end - start);
    if (!line.empty() && line.back() == '\r') {
      line.remove_suffix(1);
    }
    if (line.empty()) {
      if (has_data_) {
        events.push_back(std::move(data_));
      }
      data_.clear();
      has_data_ = false;
    } else if (line.substr(0, 5) == "data:") {
      line.remove_prefix(5);
      if (!line.empty() && line.front() == ' ') {
        line.remove_prefix(1);
      }
      if (has_data_) {
        data_ += '\n';
      }
      data_.append(line);
      has_data_ = true;
    }
    // Comments (":keep-alive") and the event, id and retry fields carry nothing we show.
  }
  pending_.erase(0, start);
  return events;
}

ApiClient::ApiClient(const std::string& url, std::string token, const std::string& ca_certificate)
    : url_(url), token_(std::move(token)) {
  if (!IsAgentUrl(url_)) {
    return;  // every call reports the bad URL
  }
  http_ = std::make_unique<httplib::Client>(url_);
  if (!ca_certificate.empty()) {
    http_->set_ca_cert_path(ca_certificate.c_str());
  }
  http_->set_connection_timeout(kConnectTimeoutSeconds);
  http_->set_read_timeout(kReadTimeoutSeconds);
  if (!token_.empty()) {
    http_->set_bearer_token_auth(token_);
  }
}

ApiClient::~ApiClient() = default;

Result ApiClient::Get(const std::string& target, Json* reply) {
  if (http_ == nullptr || !http_->is_valid()) {
    return BadUrl(url_);
  }
  return Finish(url_, http_->Get(target), reply);
}

Result ApiClient::Put(const std::string& target, const Json& body, Json* reply) {
  if (http_ == nullptr || !http_->is_valid()) {
    return BadUrl(url_);
  }
  return Finish(url_, http_->Put(target, body.dump(), "application/json"), reply);
}

Result ApiClient::Delete(const std::string& target, Json* reply) {
  if (http_ == nullptr || !http_->is_valid()) {
    return BadUrl(url_);
  }
  return Finish(url_, http_->Delete(target), reply);
}

Result ApiClient::Stream(const std::string& target,
                         const std::function<bool(const Json&)>& on_event) {
  if (http_ == nullptr || !http_->is_valid()) {
    return BadUrl(url_);
  }
  http_->set_read_timeout(kStreamReadTimeout);
  int status = 0;
  std::string error_body;  // the body of a refused stream, for its {"error": ...}
  bool stopped = false;    // on_event asked to stop
  SseParser parser;
  httplib::Result result = http_->Get(
      target, httplib::Headers{{"Accept", "text/event-stream"}},
      [&](const httplib::Response& response) {
        status = response.status;
        return true;
      },
      [&](const char* data, std::size_t size) {
        if (status < 200 || status >= 300) {
          error_body.append(data, size);
          return true;
        }
        for (const std::string& text : parser.Feed(std::string(data, size))) {
          const Json event = Json::parse(text, nullptr, false);
          if (!event.is_discarded() && !on_event(event)) {
            stopped = true;
            return false;
          }
        }
        return true;
      });
  http_->set_read_timeout(kReadTimeoutSeconds);
  if (stopped) {
    return Result::Ok();
  }
  if (!result) {
    if (status >= 200 && status < 300) {
      return Result::Error("the event stream from " + url_ +
                           " broke off: " + Describe(result.error()));
    }
    return ConnectionError(url_, result.error());
  }
  if (result->status < 200 || result->status >= 300) {
    return HttpError(result->status, error_body.empty() ? result->body : error_body);
  }
  return Result::Error("the agent at " + url_ + " ended the event stream");
}

}  // namespace q7ctl
