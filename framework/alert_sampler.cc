#include "framework/alert_sampler.h"

#include <algorithm>
#include <utility>

#include "framework/clock.h"
#include "framework/events.h"
#include "framework/row_filter.h"
#include "framework/sample_query.h"
#include "framework/status.h"
#include "framework/trace.h"

namespace fw {
namespace {

constexpr char kUnit[] = "alerts";

}  // namespace

std::vector<MatchedRow> MatchedRows(const Sample& sample) {
  std::vector<MatchedRow> matched;
  if (sample.table == nullptr) {
    return matched;
  }
  std::vector<std::string> keys = sample.table->key_columns;
  if (keys.empty()) {
    for (const ColumnInfo& column : sample.table->columns) {
      if (IsTextColumn(column)) {
        keys.push_back(column.name);
      }
    }
  }
  const nlohmann::ordered_json json = SampleToJson(sample);
  for (const nlohmann::ordered_json& row : json["rows"]) {
    MatchedRow one;
    one.key = nlohmann::ordered_json::object();
    for (const std::string& key : keys) {
      const auto it = row.find(key);
      one.key[key] = it == row.end() ? nlohmann::ordered_json() : *it;
    }
    one.values = row;
    matched.push_back(std::move(one));
  }
  return matched;
}

AlertSampler::AlertSampler(AlertBook* book, WebhookSender* webhooks, std::function<bool()> ready)
    : book_(book), webhooks_(webhooks), ready_(std::move(ready)) {}

AlertSampler::~AlertSampler() {
  Stop();
}

void AlertSampler::Start() {
  MutexLock lock(mutex_);
  if (!thread_.joinable() && !stopping_) {
    thread_ = std::thread([this] {
      SetThreadName("Alert Sampler");
      Run();
    });
  }
}

void AlertSampler::Stop() {
  {
    MutexLock lock(mutex_);
    stopping_ = true;
  }
  wake_.NotifyAll();
  if (thread_.joinable()) {
    thread_.join();
  }
}

void AlertSampler::SituationStarted(const SituationInfo& info) {
  if (!info.alert.has_value()) {
    return;
  }
  {
    MutexLock lock(mutex_);
    Scheduled& s = scheduled_[info.name];
    s.info = info;
    s.due = std::chrono::steady_clock::now();
    s.generation = ++next_generation_;
    rescheduled_ = true;
  }
  wake_.NotifyAll();
}

void AlertSampler::SituationStopped(const std::string& name) {
  {
    MutexLock lock(mutex_);
    const auto it = scheduled_.find(name);
    std::string webhook;
    if (it != scheduled_.end()) {
      webhook = it->second.info.alert->webhook;
      scheduled_.erase(it);
    }
    stopped_.push_back({name, webhook});
  }
  wake_.NotifyAll();
}

AlertSampler::Counters AlertSampler::counters() const {
  MutexLock lock(mutex_);
  return counters_;
}

void AlertSampler::WriteMetrics(PrometheusText& text) const {
  const Counters mine = counters();
  text.family("q7_alert_samples_total", "counter", "Samples taken for alerting situations.");
  text.sample("q7_alert_samples_total", {}, static_cast<double>(mine.samples));
  text.family("q7_alert_sample_failures_total", "counter",
              "Samples of alerting situations that their table refused.");
  text.sample("q7_alert_sample_failures_total", {}, static_cast<double>(mine.sample_failures));
  text.family("q7_alert_changes_total", "counter", "Alerts raised and cleared.");
  text.sample("q7_alert_changes_total", {}, static_cast<double>(mine.changes));
  text.family("q7_alerts_open", "gauge", "Alerts open now.");
  text.sample("q7_alerts_open", {}, static_cast<double>(book_->Open().size()));
  if (webhooks_ == nullptr) {
    return;
  }
  const WebhookSender::Counters sent = webhooks_->counters();
  text.family("q7_webhook_deliveries_total", "counter",
              "Alert changes handed to webhooks, by what became of them.");
  for (const auto& [result, value] :
       {std::pair<const char*, std::uint64_t>{"delivered", sent.delivered},
        {"given_up", sent.given_up},
        {"dropped_full", sent.dropped_full},
        {"dropped_invalid", sent.dropped_invalid}}) {
    text.sample("q7_webhook_deliveries_total", {{"result", result}}, static_cast<double>(value));
  }
  text.family(
      "q7_webhook_attempts_failed_total", "counter",
      "Webhook POSTs that failed (timeout, refused, not 2xx); each is retried or given up.");
  text.sample("q7_webhook_attempts_failed_total", {}, static_cast<double>(sent.attempts_failed));
  text.family("q7_webhook_pending", "gauge", "Alert changes waiting for their webhook.");
  text.sample("q7_webhook_pending", {}, static_cast<double>(sent.pending));
}

void AlertSampler::Run() {
  for (;;) {
    std::vector<Stopped> forget;
    SituationInfo next;
    std::uint64_t generation = 0;
    {
      MutexLock lock(mutex_);
      // Sleeps until a situation is due, one is stopped, or the sampler is.
      for (;;) {
        if (stopping_) {
          return;
        }
        if (!stopped_.empty()) {
          forget.swap(stopped_);
          break;
        }
        auto due = scheduled_.end();
        for (auto it = scheduled_.begin(); it != scheduled_.end(); ++it) {
          if (due == scheduled_.end() || it->second.due < due->second.due) {
            due = it;
          }
        }
        const auto now = std::chrono::steady_clock::now();
        if (due != scheduled_.end() && due->second.due <= now) {
          next = due->second.info;
          generation = due->second.generation;
          due->second.due = now + std::chrono::seconds(due->second.info.alert->every);
          break;
        }
        const auto wait = due == scheduled_.end() ? std::chrono::steady_clock::duration::max()
                                                  : due->second.due - now;
        const auto capped = std::min<std::chrono::steady_clock::duration>(
            wait, std::chrono::seconds(60));  // a bound on any one wait; the loop looks again
        rescheduled_ = false;
        wake_.WaitFor(mutex_, capped, [this]() REQUIRES(mutex_) {
          return stopping_ || !stopped_.empty() || rescheduled_;
        });
      }
    }
    for (const Stopped& s : forget) {
      Publish(book_->ForgetSituation(s.name, Now()), s.webhook);
    }
    if (generation != 0 && ready_()) {
      SampleOne(next, generation);
    }
  }
}

void AlertSampler::SampleOne(const SituationInfo& info, std::uint64_t generation) {
  Sample sample;
  std::string error;
  const int rc = SampleTable(info.table, info.conditions, &sample, &error, kNoRowLimit, info.name);
  {
    MutexLock lock(mutex_);
    ++counters_.samples;
    if (rc != kOk) {
      ++counters_.sample_failures;
    }
    // Started again or stopped while it was sampled: the result belongs to no situation now.
    const auto it = scheduled_.find(info.name);
    if (it == scheduled_.end() || it->second.generation != generation) {
      return;
    }
  }
  if (rc != kOk) {
    Q7_TRACE(kUnit, kTraceError, "situation %s: sample of %s failed: %s", info.name.c_str(),
             info.table.c_str(), error.c_str());
    return;
  }
  const AlertSettings& alert = *info.alert;
  Publish(book_->Evaluate(info.name, info.table, alert.severity, alert.for_count,
                          MatchedRows(sample), Now()),
          alert.webhook);
}

void AlertSampler::Publish(const std::vector<AlertChange>& changes, const std::string& webhook) {
  if (changes.empty()) {
    return;
  }
  {
    MutexLock lock(mutex_);
    counters_.changes += changes.size();
  }
  for (const AlertChange& change : changes) {
    nlohmann::ordered_json json = change.ToJson();
    Q7_TRACE(
        kUnit, kTraceSummary, "situation %s: %s %s", change.situation.c_str(),
        std::string(AlertKindName(change.kind)).c_str(),
        change.key.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace).c_str());
    if (!webhook.empty() && webhooks_ != nullptr) {
      webhooks_->Enqueue(
          webhook, json.dump(-1, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
    }
    PushEventJson(kAlertEventStream, std::move(json));
  }
}

}  // namespace fw
