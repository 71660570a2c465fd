#include "collector/sm3gen/ground_truth.h"

#include <algorithm>

namespace sm3gen {
namespace {

constexpr size_t kNameWidth = 127;
constexpr size_t kUrlSlotWidth = 254;

std::string Cut(std::string_view text, size_t width) {
  return std::string(text.substr(0, std::min(text.size(), width)));
}

}  // namespace

std::string ApplicationName(const Record& record) {
  if (UsesPageLayout(record.kind) && !record.host.empty()) {
    return Cut(record.host, kNameWidth);
  }
  return Cut(record.server_address, kNameWidth);
}

std::string TransactionName(const Record& record) {
  return Cut(Cut(record.url, kUrlSlotWidth), kNameWidth);
}

void Tally::Add(int32_t response_ms, int32_t status) {
  rt_min = count == 0 ? response_ms : std::min(rt_min, response_ms);
  rt_max = count == 0 ? response_ms : std::max(rt_max, response_ms);
  ++count;
  rt_sum += response_ms;
  if (status >= 100 && status <= 199) {
    ++status_1xx;
  } else if (status >= 200 && status <= 299) {
    ++status_2xx;
  } else if (status >= 300 && status <= 399) {
    ++status_3xx;
  } else if (status >= 400 && status <= 499) {
    ++status_4xx;
  } else if (status >= 500 && status <= 599) {
    ++status_5xx;
  }
  status_403 += status == 403;
  status_404 += status == 404;
  status_500 += status == 500;
  status_bad += status >= 401;
}

nlohmann::json Tally::ToJson() const {
  return {{"count", count},
          {"rt_sum", rt_sum},
          {"rt_min", rt_min},
          {"rt_max", rt_max},
          {"status",
           {{"1xx", status_1xx},
            {"2xx", status_2xx},
            {"3xx", status_3xx},
            {"4xx", status_4xx},
            {"5xx", status_5xx},
            {"403", status_403},
            {"404", status_404},
            {"500", status_500},
            {"bad", status_bad}}}};
}

void GroundTruth::AddRecord(const Record& record) {
  first_time_ = records_ == 0 ? record.time_utc : std::min<int64_t>(first_time_, record.time_utc);
  last_time_ = records_ == 0 ? record.time_utc : std::max<int64_t>(last_time_, record.time_utc);
  ++records_;
  ++by_kind_[static_cast<int>(record.kind) - 1];
  ApplicationTruth& app = applications_[ApplicationName(record)];
  UrlTruth& url = app.urls[TransactionName(record)];
  const bool page = record.kind == RecordKind::kPage;
  (page ? app.pages : app.objects).Add(record.response_ms, record.status);
  (page ? url.pages : url.objects).Add(record.response_ms, record.status);
}

nlohmann::json GroundTruth::ToJson() const {
  nlohmann::json apps = nlohmann::json::object();
  for (const auto& [name, app] : applications_) {
    nlohmann::json urls = nlohmann::json::object();
    for (const auto& [url_name, url] : app.urls) {
      urls[url_name] = {{"pages", url.pages.ToJson()}, {"objects", url.objects.ToJson()}};
    }
    apps[name] = {{"pages", app.pages.ToJson()},
                  {"objects", app.objects.ToJson()},
                  {"urls", std::move(urls)}};
  }
  return {{"seed", seed_},
          {"records", records_},
          {"bytes", bytes_},
          {"first_time", first_time_},
          {"last_time", last_time_},
          {"by_kind",
           {{"hpage", by_kind_[0]},
            {"hobj", by_kind_[1]},
            {"audio", by_kind_[2]},
            {"video", by_kind_[3]}}},
          {"junk_blocks", junk_blocks_},
          {"truncated_tail", truncated_tail_},
          {"applications", std::move(apps)}};
}

}  // namespace sm3gen
