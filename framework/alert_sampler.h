#pragma once

// AlertSampler: the thread that samples the tables of alerting situations. Every situation on
// a row table is sampled every `every` seconds with its conditions, as a type-3 request that
// carries its name; the rows that come back, told apart by the table's key columns, go to the
// AlertBook, and every raise or clear the book returns is POSTed to the situation's webhook.
// The API reads the book for the alerts and their stream.
//
// Ownership: the main loop owns the book, the webhook sender and the sampler, makes the sampler
// the situations' listener before restoring them, and stops the sampler before the others go.
//
// Thread safety: SituationStarted and SituationStopped may be called from any thread (the
// situations' lock is held then; they only note the change and wake the thread, which is the
// only one that samples, evaluates and forgets). counters() from any thread.

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <thread>
#include <vector>

#include "framework/alert_book.h"
#include "framework/mutex.h"
#include "framework/prometheus_text.h"
#include "framework/situations.h"
#include "framework/table_sample.h"
#include "framework/webhook_sender.h"

namespace fw {

// The rows of a sample as the alert book takes them: each row's key columns (the table's, or
// every text column when it names none) and all its values.
std::vector<MatchedRow> MatchedRows(const Sample& sample);

class AlertSampler : public SituationListener {
 public:
  struct Counters {
    std::uint64_t samples = 0;          // samples taken
    std::uint64_t sample_failures = 0;  // samples the table refused (traced)
    std::uint64_t changes = 0;          // raises and clears
  };

  // book and webhooks must outlive the sampler. The thread starts with Start. Until ready()
  // holds, nothing is sampled: an agent that has not yet restored its saved data answers with
  // empty tables, which would clear every open alert (and raise them again soon after).
  AlertSampler(
      AlertBook* book, WebhookSender* webhooks, std::function<bool()> ready = [] { return true; });
  ~AlertSampler() override;  // Stop()
  AlertSampler(const AlertSampler&) = delete;
  AlertSampler& operator=(const AlertSampler&) = delete;

  void Start() EXCLUDES(mutex_);
  // Ends the thread after the sample in progress, if any. Safe to call twice.
  void Stop() EXCLUDES(mutex_);

  // A situation on a pattern table (no alert settings) is ignored; a restart of one of the same
  // name replaces it and samples it at once.
  void SituationStarted(const SituationInfo& info) override EXCLUDES(mutex_);
  // Its open alerts clear (and are POSTed) on the sampler's thread.
  void SituationStopped(const std::string& name) override EXCLUDES(mutex_);

  Counters counters() const EXCLUDES(mutex_);

  // The alert series of /metrics: samples, changes, open alerts, webhook deliveries.
  void WriteMetrics(PrometheusText& text) const EXCLUDES(mutex_);

 private:
  struct Scheduled {
    SituationInfo info;
    std::chrono::steady_clock::time_point due;
    std::uint64_t generation = 0;  // changes when the situation is started again or stopped
  };
  struct Stopped {
    std::string name;
    std::string webhook;
  };

  void Run() EXCLUDES(mutex_);
  void SampleOne(const SituationInfo& info, std::uint64_t generation) EXCLUDES(mutex_);
  void Publish(const std::vector<AlertChange>& changes, const std::string& webhook)
      EXCLUDES(mutex_);

  AlertBook* const book_;
  WebhookSender* const webhooks_;
  const std::function<bool()> ready_;

  mutable Mutex mutex_;
  CondVar wake_;
  std::map<std::string, Scheduled> scheduled_ GUARDED_BY(mutex_);
  std::vector<Stopped> stopped_ GUARDED_BY(mutex_);  // to forget, on the thread
  std::uint64_t next_generation_ GUARDED_BY(mutex_) = 0;
  bool rescheduled_ GUARDED_BY(mutex_) = false;  // a situation started since the last look
  bool stopping_ GUARDED_BY(mutex_) = false;
  Counters counters_ GUARDED_BY(mutex_);
  std::thread thread_;  // started and joined by the owner's thread
};

}  // namespace fw
