// sm3writer: the collector's writer process. It reads records from the FIFO the capture
// process writes to and appends them to the live .sm3 file in the data directory, rolling it
// over by size or age the way the agent expects.

#include <CLI/CLI.hpp>
#include <cstdint>
#include <cstdio>
#include <limits>
#include <string>

#include "collector/common/process.h"
#include "collector/writer/writer_loop.h"

namespace {

constexpr char kFooter[] =
    R"(Only complete records reach the files: a record still arriving waits for its rest, bytes
between records and records cut off by their producer are dropped. The live file is
<data-dir>/<stem>.sm3; a rollover renames it to <stem>-NNNN.sm3, NNNN counting on from the
highest number in the directory, and creates the new live file at once.
SIGTERM or SIGINT: the complete records already in the FIFO are written, a partial one is
dropped, the truth is written, the pid file removed, and the exit status is 0.
Exit status: 0 stopped by a signal, 1 could not start, 2 bad command line.)";

constexpr int kUsageError = 2;

}  // namespace

int main(int argc, char** argv) {
  collector::RestoreStopSignals();
  collector::InstallStopHandlers();

  CLI::App app{"sm3writer: appends the capture process's records to the collector's data files",
               "sm3writer"};
  app.footer(kFooter);
  collector::WriterOptions options;
  std::string pid_path;
  app.add_option("--fifo", options.fifo, "FIFO to read records from (created when missing)")
      ->required();
  app.add_option("--data-dir", options.file.dir, "Data directory (created when missing)")
      ->required();
  app.add_option("--stem", options.file.stem, "Live file name without .sm3")
      ->capture_default_str()
      ->check([](const std::string& stem) {
        return stem.empty() || stem.find_first_of("/.-") != std::string::npos
                   ? std::string("must be non-empty without '/', '.' or '-'")
                   : std::string();
      });
  app.add_option("--roll-bytes", options.file.roll_bytes,
                 "Roll the live file before it would exceed this size; 0 for never")
      ->capture_default_str();
  app.add_option("--roll-seconds", options.file.roll_seconds,
                 "Roll the live file once it has held data this long; 0 for never")
      ->capture_default_str()
      ->check(CLI::Range(int64_t{0}, std::numeric_limits<int64_t>::max()));
  app.add_option("--pid-file", pid_path, "Write this process's id here; removed at exit");
  app.add_option("--truth", options.truth_path,
                 "Keep the ground truth of what was appended in this JSON file (rewritten "
                 "every second and at exit)");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kUsageError;
  }

  // The pid file appears only once the writer can run, so sm3ctl's wait for it means success.
  std::string error;
  collector::Writer writer(options);
  collector::PidFile pid_file;
  if (!writer.Open(&error) || !pid_file.Write(pid_path, &error)) {
    std::fprintf(stderr, "sm3writer: %s\n", error.c_str());
    return 1;
  }
  writer.Run();
  return 0;
}
