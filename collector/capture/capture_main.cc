// sm3capture: the collector's capture process for plain HTTP/1.x on the wire. It reads packets
// from an interface or a capture file and writes one .sm3 record per request/response
// exchange, a page directly followed by its objects, into the writer's FIFO or a file.

#include <unistd.h>

#include <CLI/CLI.hpp>
#include <algorithm>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>

#include "collector/capture/capture_pipeline.h"
#include "collector/capture/pcap_source.h"
#include "collector/capture/record_output.h"
#include "collector/common/process.h"

namespace {

constexpr char kFooter[] = R"(
Sources: --interface captures live (needs CAP_NET_RAW: run as root, or once
  setcap cap_net_raw,cap_net_admin=eip /path/to/sm3capture); --read FILE reads a pcap or
  pcapng file. Link types: Ethernet (with VLAN tags), Linux cooked (SLL, SLL2), loopback,
  raw IP; IPv4 and IPv6. Live capture filters with "tcp port 80 or tcp port 8080" unless
  --filter says otherwise; a file is read whole unless --filter is given.
Output: one record per line. A text/html reply is a page (<hpage>); a reply whose Referer
  names a page of the same client seen in the 30 s before is an object of it (<hobj>, or
  <audio>/<video> by content type), written after its page once the view closes (the
  client's next page, 5 s after its last reply, 30 s after it began, or the end of input);
  any other reply is a page of its own. --fifo feeds the writer process (sm3writer) as
  sm3gen --live does: records wait in memory for a reader (16 MiB at most, then they are
  counted lost); --out writes a file ("-" for standard output).
Not visible to a passive capture: HTTPS (TLS), HTTP/2 and HTTP/3 (QUIC). For those, read the
  web server's access log instead (the accesslog collector mode).
Counters: printed on standard error every --stats seconds while live, and always once at the
  end as "sm3capture: packets=... exchanges=... pages=... objects=... gaps=...".
Exit status: 0 done (also after SIGINT or SIGTERM, with every finished record written), 1 the
  input or output cannot be used (the message says why), 2 bad command line.)";

constexpr int kUsageError = 2;

using Clock = std::chrono::steady_clock;

capture::Micros WallMicros() {
  return std::chrono::duration_cast<std::chrono::microseconds>(
             std::chrono::system_clock::now().time_since_epoch())
      .count();
}

std::string HostName() {
  char name[256] = "";
  ::gethostname(name, sizeof(name) - 1);
  return name;
}

void PrintStats(const char* label, const capture::CaptureStats& stats) {
  std::fprintf(stderr, "sm3capture: %s%s\n", label, stats.Format().c_str());
  std::fflush(stderr);
}

}  // namespace

int main(int argc, char** argv) {
  collector::RestoreStopSignals();
  CLI::App app{"sm3capture: HTTP/1.x seen on the wire as .sm3 collector records", "sm3capture"};
  app.footer(kFooter);

  capture::SourceOptions source;
  capture::PipelineOptions pipeline;
  std::string out_path;
  std::string fifo_path;
  std::string pid_path;
  int stats_seconds = 0;
  int64_t idle_seconds = 300;
  uint32_t max_buffered_kb = pipeline.tcp.max_buffered_bytes / 1024;
  uint64_t max_total_buffered_mb = pipeline.tcp.max_total_buffered_bytes >> 20;
  size_t max_head_kb = pipeline.max_head_bytes / 1024;
  pipeline.collector_id = HostName();

  auto* interface_option =
      app.add_option("-i,--interface", source.interface, "Capture live on this interface");
  // No ExistingFile check: an unreadable input is exit 1 with libpcap's reason, not a usage error.
  auto* read_option = app.add_option("-r,--read", source.read_file, "Read this pcap/pcapng file");
  interface_option->excludes(read_option);
  auto* filter_option =
      app.add_option("-f,--filter", source.filter,
                     "BPF filter (live default: \"tcp port 80 or tcp port 8080\"; files: none)");
  app.add_option("--snaplen", source.snaplen, "Live: bytes kept of each packet")
      ->capture_default_str()
      ->check(CLI::Range(96, 262144));
  app.add_flag("--promiscuous", source.promiscuous,
               "Live: put the interface in promiscuous mode (off by default)");
  app.add_option("--buffer-mb", source.buffer_mb, "Live: kernel capture buffer, MiB")
      ->capture_default_str()
      ->check(CLI::Range(1, 2048));
  auto* out_option =
      app.add_option("-o,--out", out_path, "Write records to this file (\"-\": standard output)");
  auto* fifo_option = app.add_option("--fifo", fifo_path,
                                     "Write records into the writer's FIFO (created if missing)");
  out_option->excludes(fifo_option);
  app.add_option("--pid-file", pid_path, "Keep this pid file while running");
  app.add_option("--stats", stats_seconds,
                 "Live: print the counters every this many seconds (0: only at the end)")
      ->capture_default_str()
      ->check(CLI::NonNegativeNumber);
  app.add_option("--idle-timeout", idle_seconds, "End a connection idle this many seconds")
      ->capture_default_str()
      ->check(CLI::Range(1, 86400));
  app.add_option("--max-connections", pipeline.tcp.max_connections,
                 "Connections tracked at once; more are ignored and counted")
      ->capture_default_str()
      ->check(CLI::Range(1, 10000000));
  app.add_option("--max-buffered-kb", max_buffered_kb,
                 "Out-of-order bytes held per direction before a hole is given up, KiB")
      ->capture_default_str()
      ->check(CLI::Range(1, 1048576));
  app.add_option("--max-total-buffered-mb", max_total_buffered_mb,
                 "Out-of-order bytes held in all, MiB")
      ->capture_default_str()
      ->check(CLI::Range(1, 65536));
  app.add_option("--max-head-kb", max_head_kb, "Largest HTTP head accepted, KiB")
      ->capture_default_str()
      ->check(CLI::Range(1, 16384));
  app.add_option("--collector-id", pipeline.collector_id,
                 "Collector ID field of every record (default: the host name)");
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    const int status = app.exit(e);
    return status == 0 ? 0 : kUsageError;
  }

  if (source.interface.empty() == source.read_file.empty()) {
    std::fprintf(stderr, "sm3capture: give one of --interface and --read (see --help)\n");
    return kUsageError;
  }
  if (out_path.empty() == fifo_path.empty()) {
    std::fprintf(stderr, "sm3capture: give one of --out and --fifo (see --help)\n");
    return kUsageError;
  }
  if (filter_option->count() == 0 && !source.interface.empty()) {
    source.filter = "tcp port 80 or tcp port 8080";
  }
  pipeline.tcp.idle_timeout = idle_seconds * 1000000;
  pipeline.tcp.max_buffered_bytes = max_buffered_kb * 1024;
  pipeline.tcp.max_total_buffered_bytes = max_total_buffered_mb << 20;
  pipeline.max_head_bytes = max_head_kb * 1024;
  pipeline.product_version = Q7_PRODUCT_VERSION;

  // Stop requests from here on end the loop; finished records are still written.
  collector::InstallStopHandlers();
  std::string error;
  capture::CaptureStats stats;
  std::unique_ptr<capture::RecordOutput> output =
      capture::OpenRecordOutput(out_path, fifo_path, &stats, &error);
  if (output == nullptr) {
    std::fprintf(stderr, "sm3capture: %s\n", error.c_str());
    return 1;
  }
  capture::PcapSource pcap;
  if (!pcap.Open(source, &error)) {
    std::fprintf(stderr, "sm3capture: %s\n", error.c_str());
    return 1;
  }
  collector::PidFile pid_file;
  if (!pid_file.Write(pid_path, &error)) {
    std::fprintf(stderr, "sm3capture: %s\n", error.c_str());
    return 1;
  }
  if (pcap.live()) {
    std::fprintf(stderr, "sm3capture: capturing on %s with filter \"%s\"\n",
                 source.interface.c_str(), source.filter.c_str());
    std::fflush(stderr);
  }

  capture::CapturePipeline pipe(pipeline, output.get(), &stats);
  capture::Micros last_time = 0;
  struct Tracker {
    capture::CapturePipeline* pipe;
    capture::Micros* last_time;
  } tracker{&pipe, &last_time};
  auto on_packet = [](void* context, int link_type, const uint8_t* data, uint32_t caplen,
                      uint32_t wire_len, capture::Micros time) {
    auto* t = static_cast<Tracker*>(context);
    *t->last_time = std::max(*t->last_time, time);
    t->pipe->AddPacket(link_type, data, caplen, wire_len, time);
  };

  int status = 0;
  Clock::time_point next_stats = Clock::now() + std::chrono::seconds(stats_seconds);
  while (!collector::StopRequested()) {
    const auto result = pcap.Dispatch(on_packet, &tracker, 100, &error);
    if (result == capture::PcapSource::Status::kError) {
      if (pcap.live()) {
        std::fprintf(stderr, "sm3capture: capture failed: %s\n", error.c_str());
        status = 1;
      } else {
        // A damaged or truncated file: what came before the damage is still good.
        std::fprintf(stderr, "sm3capture: %s: %s; stopping there\n", source.read_file.c_str(),
                     error.c_str());
      }
      break;
    }
    if (result == capture::PcapSource::Status::kEnd) {
      break;
    }
    if (pcap.live()) {
      pipe.Tick(WallMicros());
      if (stats_seconds > 0 && Clock::now() >= next_stats) {
        next_stats = Clock::now() + std::chrono::seconds(stats_seconds);
        stats.pcap_drops = pcap.Drops();
        PrintStats("stats: ", stats);
      }
    }
    // A file is read faster than any writer takes records: wait for the reader rather than
    // lose them. Live traffic cannot wait, so there the queue's limit counts them lost.
    const bool pumped = capture::PumpOutput(output.get(), !pcap.live(), &error);
    if (!pumped) {
      std::fprintf(stderr, "sm3capture: %s\n", error.c_str());
      status = 1;
      break;
    }
  }
  // Everything still open is written: a file's end is the end of its traffic, and a stopped
  // live capture keeps what it saw.
  pipe.Finish(pcap.live() ? WallMicros() : last_time);
  stats.pcap_drops = pcap.Drops();
  if (!output->Finish(Clock::now() + std::chrono::seconds(1), &error)) {
    std::fprintf(stderr, "sm3capture: %s\n", error.c_str());
    status = 1;
  }
  PrintStats("", stats);
  return status;
}
