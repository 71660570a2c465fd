// sm3gen: writes collector .sm3 test data and the ground truth an agent must find in it.

#include <CLI/CLI.hpp>
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <ctime>
#include <limits>
#include <map>
#include <string>

#include "collector/sm3gen/file_mode.h"

namespace {

constexpr char kFooter[] =
    R"(Output: one record per line, <hpage>, <hobj>, <audio> or <video>, a page directly
followed by its embedded objects. The same options give the same bytes and truth; set --start
for that, since its default follows the clock.
Exit status: 0 success, 1 I/O error, 2 bad command line.)";

constexpr int kUsageError = 2;

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"sm3gen: writes collector .sm3 test data with its ground truth", "sm3gen"};
  app.footer(kFooter);

  sm3gen::FileJob job;
  sm3gen::ModelOptions& model = job.model;
  int64_t start = 0;
  std::string eol = "lf";
  app.add_option("--out", job.out_path, "Output file, - for standard output")->required();
  app.add_option("--records", job.records, "Complete records to write, all kinds counted")
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
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kUsageError;
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
