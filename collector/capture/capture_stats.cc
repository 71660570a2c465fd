#include "collector/capture/capture_stats.h"

#include <fmt/format.h>

namespace capture {

std::string CaptureStats::Format() const {
  return fmt::format(
      "packets={} bytes={} tcp={} not_tcp={} truncated={} fragments={} unsupported_link={} "
      "pcap_drops={} connections={} connections_capped={} connections_expired={} "
      "retransmissions={} out_of_order={} gaps={} gap_bytes={} buffer_overflows={} "
      "exchanges={} pages={} objects={} orphan_objects={} unmatched_requests={} "
      "unmatched_responses={} non_http={} midstream={} dropped_heads={} lost_framing={} "
      "records={} records_lost={}",
      packets, bytes, tcp_segments, not_tcp, truncated_packets, ip_fragments, unsupported_link,
      pcap_drops, connections, connections_capped, connections_expired, retransmissions,
      out_of_order, gaps, gap_bytes, buffer_overflows, exchanges, pages, objects, orphan_objects,
      unmatched_requests, unmatched_responses, non_http_streams, midstream, dropped_heads,
      lost_framing, records, records_lost);
}

}  // namespace capture
