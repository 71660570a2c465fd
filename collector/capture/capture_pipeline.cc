#include "collector/capture/capture_pipeline.h"

#include "collector/capture/http_connection.h"
#include "collector/capture/packet_decoder.h"
#include "collector/capture/page_assembler.h"
#include "collector/capture/record_builder.h"

namespace capture {

class CapturePipeline::Impl {
 public:
  Impl(const PipelineOptions& options, RecordSink* sink, CaptureStats* stats)
      : stats_(stats),
        builder_(options.product_version, options.collector_id),
        pages_(&builder_, sink, stats),
        connections_(&pages_, stats, options.max_head_bytes),
        tcp_(options.tcp, &connections_, stats) {}

  void AddPacket(int link_type, const uint8_t* data, uint32_t caplen, Micros time) {
    ++stats_->packets;
    stats_->bytes += caplen;
    TcpSegment segment;
    switch (DecodePacket(link_type, data, caplen, time, &segment)) {
      case DecodeResult::kTcp:
        ++stats_->tcp_segments;
        tcp_.Add(segment);
        break;
      case DecodeResult::kNotTcp:
        ++stats_->not_tcp;
        break;
      case DecodeResult::kTruncated:
        ++stats_->truncated_packets;
        break;
      case DecodeResult::kFragment:
        ++stats_->ip_fragments;
        break;
      case DecodeResult::kUnsupportedLink:
        ++stats_->unsupported_link;
        break;
    }
    Tick(time);
  }

  void Tick(Micros now) {
    tcp_.Expire(now);
    pages_.Advance(now);
  }

  void Finish(Micros now) {
    tcp_.EndAll(now);
    pages_.Flush();
  }

 private:
  CaptureStats* const stats_;
  RecordBuilder builder_;
  PageAssembler pages_;
  HttpConnectionFactory connections_;
  TcpReassembler tcp_;  // last: its connections report to the members above as they end
};

CapturePipeline::CapturePipeline(const PipelineOptions& options, RecordSink* sink,
                                 CaptureStats* stats)
    : impl_(std::make_unique<Impl>(options, sink, stats)) {}

CapturePipeline::~CapturePipeline() = default;

void CapturePipeline::AddPacket(int link_type, const uint8_t* data, uint32_t caplen, uint32_t,
                                Micros time) {
  impl_->AddPacket(link_type, data, caplen, time);
}

void CapturePipeline::Tick(Micros now) {
  impl_->Tick(now);
}

void CapturePipeline::Finish(Micros now) {
  impl_->Finish(now);
}

}  // namespace capture
