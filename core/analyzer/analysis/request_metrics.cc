#include "core/analyzer/analysis/request_metrics.h"

#include <algorithm>
#include <limits>

#include "framework/prometheus_text.h"

namespace {

// Milliseconds: Prometheus's usual ladder, to a minute.
constexpr int32_t kLadder[] = {5, 10, 25, 50, 100, 250, 500, 1000, 2500, 5000, 10000, 30000, 60000};

constexpr const char* kStatusClasses[] = {"1xx", "2xx", "3xx", "4xx", "5xx", "other"};

size_t StatusClass(int status) {
  return status >= 100 && status <= 599 ? static_cast<size_t>(status / 100 - 1) : 5;
}

std::string KeyOf(std::string_view application, std::string_view transaction) {
  return LatencyBook::transactionKey(application, transaction);
}

double Seconds(uint64_t millis) {
  return static_cast<double>(millis) / 1000.0;
}

}  // namespace

RequestMetrics::RequestMetrics(size_t maxSeries)
    : maxSeries_(std::max<size_t>(maxSeries, 1)), bounds_(std::begin(kLadder), std::end(kLadder)) {}

void RequestMetrics::addBound(int32_t millis) {
  if (millis <= 0) {
    return;
  }
  const auto at = std::lower_bound(bounds_.begin(), bounds_.end(), millis);
  if (at != bounds_.end() && *at == millis) {
    return;
  }
  const auto position = at - bounds_.begin();
  bounds_.insert(at, millis);
  // The new bucket takes none of the requests already counted: they stay in the bucket above,
  // so every cumulative count stays what it was.
  for (Series& series : series_) {
    series.buckets.insert(series.buckets.begin() + position, 0);
  }
}

RequestMetrics::Series& RequestMetrics::create(std::string_view application,
                                               std::string_view transaction, std::string key) {
  Series series;
  series.application = application;
  series.transaction = transaction;
  series.buckets.assign(bounds_.size() + 1, 0);
  index_.emplace(std::move(key), series_.size());
  series_.push_back(std::move(series));
  return series_.back();
}

RequestMetrics::Series& RequestMetrics::seriesFor(std::string_view application,
                                                  std::string_view transaction, bool* overflow) {
  *overflow = false;
  thread_local std::string key;
  key.assign(application).push_back('\0');
  key.append(transaction);
  if (const auto found = index_.find(key); found != index_.end()) {
    return series_[found->second];
  }
  const size_t used = series_.size() + reservedOthers_ + (catchAll_ < 0 ? 1 : 0);
  const auto known = others_.find(application);
  if (known != others_.end()) {
    if (used < maxSeries_) {
      return create(application, transaction, key);
    }
    *overflow = true;
    if (known->second < 0) {
      // The slot this application held for it.
      --reservedOthers_;
      known->second = static_cast<int32_t>(series_.size());
      create(application, kOther, KeyOf(application, kOther));
    }
    return series_[static_cast<size_t>(known->second)];
  }
  if (used + 2 <= maxSeries_) {
    others_.emplace(std::string(application), -1);
    ++reservedOthers_;
    return create(application, transaction, key);
  }
  *overflow = true;
  if (catchAll_ < 0) {
    catchAll_ = static_cast<int32_t>(series_.size());
    create(kOther, kOther, KeyOf(kOther, kOther));
  }
  return series_[static_cast<size_t>(catchAll_)];
}

void RequestMetrics::add(std::string_view application, std::string_view transaction,
                         const Request& request) {
  int32_t series = kUnresolved;
  add(application, transaction, request, &series);
}

void RequestMetrics::add(std::string_view application, std::string_view transaction,
                         const Request& request, int32_t* cached) {
  if (request.thresholdMillis != lastThreshold_) {
    addBound(request.thresholdMillis);
    // A threshold meant as "never slow" (up to 2^31 ms) has no 4T bucket worth having.
    if (const int64_t tolerating = 4 * static_cast<int64_t>(request.thresholdMillis);
        tolerating <= std::numeric_limits<int32_t>::max()) {
      addBound(static_cast<int32_t>(tolerating));
    }
    lastThreshold_ = request.thresholdMillis;
  }
  // The cache holds the index, or -2 - index for an "_other" series standing in for the key.
  if (*cached == kUnresolved) {
    bool overflow = false;
    const auto index =
        static_cast<int32_t>(&seriesFor(application, transaction, &overflow) - series_.data());
    *cached = overflow ? -2 - index : index;
  }
  const bool overflow = *cached < 0;
  Series& series = series_[static_cast<size_t>(overflow ? -2 - *cached : *cached)];
  if (overflow) {
    ++overflowRequests_;
  }
  if (series.requests() == 0) {
    series.thresholdMillis = request.thresholdMillis;
  }
  const int64_t response = std::max<int64_t>(request.responseMillis, 0);
  if (request.failed) {
    ++series.failed;
  } else if (response <= request.thresholdMillis) {
    ++series.good;
  } else {
    ++series.slow;
  }
  const auto bucket = std::lower_bound(bounds_.begin(), bounds_.end(), response) - bounds_.begin();
  ++series.buckets[static_cast<size_t>(bucket)];
  series.responseMillis += static_cast<uint64_t>(response);
  series.serverMillis += static_cast<uint64_t>(std::max<int64_t>(request.serverMillis, 0));
  series.networkMillis += static_cast<uint64_t>(std::max<int64_t>(request.networkMillis, 0));
  series.clientMillis += static_cast<uint64_t>(std::max<int64_t>(request.clientMillis, 0));
  ++series.statusClasses[StatusClass(request.status)];
  if (response <= series.thresholdMillis) {
    ++series.satisfied;
  } else if (response <= 4 * static_cast<int64_t>(series.thresholdMillis)) {
    ++series.tolerating;
  }
}

void RequestMetrics::write(fw::PrometheusText& out) const {
  using Label = fw::PrometheusText::Label;
  const auto labels = [](const Series& s) {
    return std::pair<Label, Label>{{"application", s.application}, {"transaction", s.transaction}};
  };
  out.family("q7_requests_total", "counter",
             "Page requests by outcome: good (within the threshold), slow, failed (bad status).");
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    out.sample("q7_requests_total", {a, t}, {"outcome", "good"}, static_cast<double>(s.good));
    out.sample("q7_requests_total", {a, t}, {"outcome", "slow"}, static_cast<double>(s.slow));
    out.sample("q7_requests_total", {a, t}, {"outcome", "failed"}, static_cast<double>(s.failed));
  }
  out.family("q7_response_time_seconds", "histogram",
             "Page response time; the buckets include every threshold T and 4T.");
  std::vector<std::string> les;
  les.reserve(bounds_.size());
  for (const int32_t bound : bounds_) {
    les.push_back(fw::PrometheusText::formatValue(bound / 1000.0));
  }
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    uint64_t cumulative = 0;
    for (size_t i = 0; i < bounds_.size(); ++i) {
      cumulative += s.buckets[i];
      out.sample("q7_response_time_seconds_bucket", {a, t}, {"le", les[i]},
                 static_cast<double>(cumulative));
    }
    out.sample("q7_response_time_seconds_bucket", {a, t}, {"le", "+Inf"},
               static_cast<double>(s.requests()));
    out.sample("q7_response_time_seconds_sum", {a, t}, Seconds(s.responseMillis));
    out.sample("q7_response_time_seconds_count", {a, t}, static_cast<double>(s.requests()));
  }
  struct Sum {
    const char* name;
    const char* help;
    uint64_t Series::*field;
  };
  for (const Sum& sum :
       {Sum{"q7_server_time_seconds_total", "Server time of page requests.", &Series::serverMillis},
        Sum{"q7_network_time_seconds_total", "Network time of page requests.",
            &Series::networkMillis},
        Sum{"q7_client_time_seconds_total",
            "Client time of page requests (response time less server time).",
            &Series::clientMillis}}) {
    out.family(sum.name, "counter", sum.help);
    for (const Series& s : series_) {
      const auto [a, t] = labels(s);
      out.sample(sum.name, {a, t}, Seconds(s.*sum.field));
    }
  }
  out.family("q7_responses_total", "counter", "Page requests by HTTP status class.");
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    for (size_t i = 0; i < s.statusClasses.size(); ++i) {
      if (s.statusClasses[i] > 0) {
        out.sample("q7_responses_total", {a, t}, {"class", kStatusClasses[i]},
                   static_cast<double>(s.statusClasses[i]));
      }
    }
  }
  out.family("q7_apdex_satisfied_total", "counter",
             "Page requests within the series' threshold T.");
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    out.sample("q7_apdex_satisfied_total", {a, t}, static_cast<double>(s.satisfied));
  }
  out.family("q7_apdex_tolerating_total", "counter",
             "Page requests over the series' threshold T and within 4T.");
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    out.sample("q7_apdex_tolerating_total", {a, t}, static_cast<double>(s.tolerating));
  }
  out.family("q7_threshold_seconds", "gauge", "The series' response-time threshold T.");
  for (const Series& s : series_) {
    const auto [a, t] = labels(s);
    out.sample("q7_threshold_seconds", {a, t}, s.thresholdMillis / 1000.0);
  }
  out.family("q7_metrics_series", "gauge", "Application and transaction series kept.");
  out.sample("q7_metrics_series", {}, static_cast<double>(series_.size()));
  out.family("q7_metrics_series_limit", "gauge", "The most series kept (KQ7METRICSMAXSERIES).");
  out.sample("q7_metrics_series_limit", {}, static_cast<double>(maxSeries_));
  out.family("q7_metrics_overflow_requests_total", "counter",
             "Page requests counted under an \"_other\" series for want of room.");
  out.sample("q7_metrics_overflow_requests_total", {}, static_cast<double>(overflowRequests_));
}
