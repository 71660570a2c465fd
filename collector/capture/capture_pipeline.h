#pragma once

// CapturePipeline: packets in, collector records out. It decodes each packet, reassembles TCP,
// parses and pairs HTTP/1.x exchanges, assembles page views and hands each finished record to
// the sink in the order the agent needs (a page directly followed by its objects). libpcap and
// the output live outside it, so tests, fuzz targets and benchmarks drive it with any bytes.
//
// Time is the capture's: packet time stamps drive reassembly timeouts and page-view closing.
// A live capture that sees no packets calls Tick with the wall clock so views still close.
//
// Thread safety: none; one thread owns the pipeline, its sink and its stats.

#include <cstdint>
#include <memory>
#include <string>

#include "collector/capture/capture_stats.h"
#include "collector/capture/record_sink.h"
#include "collector/capture/tcp_reassembler.h"
#include "collector/capture/tcp_segment.h"

namespace capture {

struct PipelineOptions {
  ReassemblerOptions tcp;
  size_t max_head_bytes = 64 * 1024;  // largest HTTP head accepted
  std::string collector_id;           // record field 4
  std::string product_version;        // record field 1
};

class CapturePipeline {
 public:
  // sink and stats must outlive the pipeline.
  CapturePipeline(const PipelineOptions& options, RecordSink* sink, CaptureStats* stats);
  ~CapturePipeline();
  CapturePipeline(const CapturePipeline&) = delete;
  CapturePipeline& operator=(const CapturePipeline&) = delete;

  // One captured packet of the given libpcap link type (DLT_*): caplen bytes at data, of a
  // packet wire_len long on the wire, captured at time.
  void AddPacket(int link_type, const uint8_t* data, uint32_t caplen, uint32_t wire_len,
                 Micros time);
  // The clock moved to now without packets: ends idle connections, closes page views.
  void Tick(Micros now);
  // End of input: every connection ends and every page view is written.
  void Finish(Micros now);

 private:
  class Impl;
  std::unique_ptr<Impl> impl_;
};

}  // namespace capture
