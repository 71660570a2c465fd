// sm3gen: writes collector .sm3 test data and the ground truth an agent must find in it.

#include <CLI/CLI.hpp>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <limits>
#include <map>
#include <string>

#include "collector/common/process.h"
#include "collector/sm3gen/file_mode.h"
#include "collector/sm3gen/live_mode.h"

namespace {

constexpr char kFooter[] =
    R"(Output: one record per line, <hpage>, <hobj>, <audio> or <video>, a page directly
followed by its embedded objects. The same options give the same bytes and truth; set --start
for that, since its default follows the clock.
Live mode (--live) is the collector's capture process: records at --rate per second of wall
time, stamped with the current time, go whole into --fifo (the writer process, sm3writer,
reads it) or straight into --out-dir with the writer's rollover. It waits for a reader rather
than fail; records due while no reader is there, or the FIFO is full, are lost, as traffic
would be. It runs until SIGTERM or SIGINT (or --records are written), stops at a record
boundary, removes --pid-file and exits 0. --truth then holds the records written whole.
Exit status: 0 success, 1 I/O error, 2 bad command line.)";

constexpr int kUsageError = 2;

// Live mode after parsing: checks the options that belong to it and runs until stopped.
int RunLive(const CLI::App& app, const CLI::Option* records_option, const sm3gen::FileJob& file_job,
            sm3gen::LiveJob* live, const std::string& pid_path) {
  for (const char* name :
       {"--out", "--append", "--truncate-tail", "--junk-every", "--eol", "--start"}) {
    if (app.get_option(name)->count() > 0) {
      std::fprintf(stderr, "sm3gen: %s is for file mode, not --live\n", name);
      return kUsageError;
    }
  }
  if (live->fifo.empty() == live->out_dir.dir.empty()) {
    std::fprintf(stderr, "sm3gen: --live needs one of --fifo and --out-dir\n");
    return kUsageError;
  }
  live->model = file_job.model;
  live->truth_path = file_job.truth_path;
  live->records = records_option->count() > 0 ? file_job.records : 0;

  // Stop requests are honoured at a record boundary from here on.
  collector::InstallStopHandlers();
  std::string error;
  collector::PidFile pid_file;
  if (!pid_file.Write(pid_path, &error)) {
    std::fprintf(stderr, "sm3gen: %s\n", error.c_str());
    return 1;
  }
  sm3gen::LiveStats stats;
  const bool ok = sm3gen::RunLiveMode(*live, &stats, &error);
  std::fprintf(stderr, "sm3gen: live mode %s: %lld records written, %lld lost\n",
               ok ? "stopped" : "failed", static_cast<long long>(stats.written),
               static_cast<long long>(stats.lost));
  if (!ok) {
    std::fprintf(stderr, "sm3gen: %s\n", error.c_str());
  }
  return ok ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  collector::RestoreStopSignals();
  CLI::App app{"sm3gen: writes collector .sm3 test data with its ground truth", "sm3gen"};
  app.footer(kFooter);

  sm3gen::FileJob job;
  sm3gen::ModelOptions& model = job.model;
  int64_t start = 0;
  std::string eol = "lf";
  CLI::Option* out_option =
      app.add_option("--out", job.out_path, "Output file, - for standard output (file mode)");
  CLI::Option* records_option =
      app.add_option("--records", job.records,
                     "Complete records to write, all kinds counted (--live: stop after this many "
                     "written; no end when not given)")
          ->capture_default_str()
          ->check(CLI::Range(int64_t{0}, int64_t{100000000}));
  app.add_option("--seed", model.seed, "Random seed")->capture_default_str();
  CLI::Option* start_option =
      app.add_option("--start", start,
                     "Time stamp of the first record, seconds since 1970 UTC "
                     "[default: now - records/rate]")
          ->check(CLI::Range(int64_t{0}, int64_t{std::numeric_limits<int32_t>::max()}));
  app.add_option("--rate", model.rate, "Records per second of traffic time")
      ->capture_default_str()
      ->check(CLI::Range(0.001, 1000000.0));
  app.add_option("--sites", model.sites, "Web sites (application hosts)")
      ->capture_default_str()
      ->check(CLI::Range(1, sm3gen::kMaxSites));
  app.add_option("--clients", model.clients, "Distinct clients")
      ->capture_default_str()
      ->check(CLI::Range(1, sm3gen::kMaxClients));
  app.add_option("--ipv6-share", model.ipv6_share, "Percent of clients that also use IPv6")
      ->capture_default_str()
      ->check(CLI::Range(0.0, 100.0));
  app.add_option("--objects", model.objects, "Mean embedded objects per ordinary page")
      ->capture_default_str()
      ->check(CLI::Range(0.0, 100.0));
  app.add_option("--av-share", model.av_share, "Percent of embedded objects that are audio/video")
      ->capture_default_str()
      ->check(CLI::Range(0.0, 100.0));
  app.add_option("--error-share", model.error_share,
                 "Percent of records with a 4xx, 5xx or odd status")
      ->capture_default_str()
      ->check(CLI::Range(0.0, 100.0));
  app.add_option("--eol", eol, "Line ends: lf, crlf, or mixed per record")
      ->capture_default_str()
      ->check(CLI::IsMember({"lf", "crlf", "mixed"}));
  app.add_option("--junk-every", job.stream.junk_every,
                 "Junk bytes before every Nth record, 0 for never")
      ->capture_default_str()
      ->check(CLI::Range(int64_t{0}, std::numeric_limits<int64_t>::max()));
  app.add_flag("--truncate-tail", job.truncate_tail,
               "End with one more record cut in its middle (not in the truth)");
  app.add_option("--truth", job.truth_path, "Write the ground truth as JSON to this file");
  app.add_flag("--append", job.append, "Append to the output file instead of replacing it");

  sm3gen::LiveJob live;
  std::string pid_path;
  bool live_mode = false;
  app.add_flag("--live", live_mode, "Live mode: emit records at --rate until stopped");
  app.add_option("--fifo", live.fifo, "Live: FIFO to write records into (created when missing)");
  app.add_option("--out-dir", live.out_dir.dir,
                 "Live: write into this data directory instead of a FIFO");
  app.add_option("--stem", live.out_dir.stem, "Live, --out-dir: live file name without .sm3")
      ->capture_default_str();
  app.add_option("--roll-bytes", live.out_dir.roll_bytes,
                 "Live, --out-dir: roll before the live file exceeds this size; 0 for never")
      ->capture_default_str();
  app.add_option("--roll-seconds", live.out_dir.roll_seconds,
                 "Live, --out-dir: roll once the live file has held data this long; 0 for never")
      ->capture_default_str()
      ->check(CLI::Range(int64_t{0}, std::numeric_limits<int64_t>::max()));
  app.add_option("--pid-file", pid_path, "Live: write this process's id here; removed at exit");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kUsageError;
  }

  if (live_mode) {
    return RunLive(app, records_option, job, &live, pid_path);
  }
  if (out_option->count() == 0) {
    std::fprintf(stderr, "sm3gen: --out is required (or --live)\n");
    return kUsageError;
  }
  for (const char* name : {"--fifo", "--out-dir", "--pid-file"}) {
    if (app.get_option(name)->count() > 0) {
      std::fprintf(stderr, "sm3gen: %s needs --live\n", name);
      return kUsageError;
    }
  }

  const std::map<std::string, sm3gen::LineEnd> line_ends = {{"lf", sm3gen::LineEnd::kLf},
                                                            {"crlf", sm3gen::LineEnd::kCrLf},
                                                            {"mixed", sm3gen::LineEnd::kMixed}};
  job.stream.line_end = line_ends.at(eol);
  // The records (and a cut-off tail) span records/rate seconds of traffic.
  const auto span = static_cast<int64_t>(std::ceil(static_cast<double>(job.records) / model.rate));
  model.start = start_option->count() > 0 ? start : std::max<int64_t>(0, std::time(nullptr) - span);
  if (model.start + span > std::numeric_limits<int32_t>::max()) {
    std::fprintf(stderr,
                 "sm3gen: %lld records at %g per second from %lld run past the 32-bit time "
                 "stamps' end (2038)\n",
                 static_cast<long long>(job.records), model.rate,
                 static_cast<long long>(model.start));
    return kUsageError;
  }
  if (job.out_path == "-" && job.truth_path == "-") {
    std::fprintf(stderr, "sm3gen: --out and --truth cannot both be standard output\n");
    return kUsageError;
  }

  std::string error;
  if (!sm3gen::RunFileMode(job, &error)) {
    std::fprintf(stderr, "sm3gen: %s\n", error.c_str());
    return 1;
  }
  return 0;
}
