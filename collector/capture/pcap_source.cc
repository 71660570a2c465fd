#include "collector/capture/pcap_source.h"

#include <fmt/format.h>
#include <poll.h>
#include <unistd.h>

namespace capture {
namespace {

struct Callback {
  PcapSource::PacketFn fn;
  void* context;
  int link_type;
};

void OnPacket(u_char* user, const struct pcap_pkthdr* header, const u_char* bytes) {
  const auto* callback = reinterpret_cast<const Callback*>(user);
  const Micros time = static_cast<Micros>(header->ts.tv_sec) * 1000000 + header->ts.tv_usec;
  callback->fn(callback->context, callback->link_type, bytes, header->caplen, header->len, time);
}

std::string PermissionHint(const std::string& interface) {
  char self[4096];
  const ssize_t n = ::readlink("/proc/self/exe", self, sizeof(self) - 1);
  const std::string path = n > 0 ? std::string(self, static_cast<size_t>(n)) : "sm3capture";
  return fmt::format(
      "no permission to capture on {}: live capture needs CAP_NET_RAW. Run sm3capture as root, "
      "or give it the capability once: setcap cap_net_raw,cap_net_admin=eip {}",
      interface, path);
}

}  // namespace

PcapSource::~PcapSource() {
  if (handle_ != nullptr) {
    pcap_close(handle_);
  }
}

bool PcapSource::Open(const SourceOptions& options, std::string* error) {
  char message[PCAP_ERRBUF_SIZE] = "";
  live_ = options.read_file.empty();
  if (!live_) {
    handle_ = pcap_open_offline_with_tstamp_precision(options.read_file.c_str(),
                                                      PCAP_TSTAMP_PRECISION_MICRO, message);
    if (handle_ == nullptr) {
      *error = fmt::format("cannot read {}: {}", options.read_file, message);
      return false;
    }
  } else {
    handle_ = pcap_create(options.interface.c_str(), message);
    if (handle_ == nullptr) {
      *error = fmt::format("cannot capture on {}: {}", options.interface, message);
      return false;
    }
    pcap_set_snaplen(handle_, options.snaplen);
    pcap_set_promisc(handle_, options.promiscuous ? 1 : 0);
    pcap_set_timeout(handle_, 100);
    pcap_set_buffer_size(handle_, options.buffer_mb << 20);
    const int status = pcap_activate(handle_);
    if (status < 0) {
      switch (status) {
        case PCAP_ERROR_PERM_DENIED:
        case PCAP_ERROR_PROMISC_PERM_DENIED:
          *error = PermissionHint(options.interface);
          break;
        case PCAP_ERROR_NO_SUCH_DEVICE:
          *error =
              fmt::format("no such interface: {} ({})", options.interface, pcap_geterr(handle_));
          break;
        default:
          *error = fmt::format("cannot capture on {}: {}", options.interface, pcap_geterr(handle_));
      }
      return false;
    }
  }
  link_type_ = pcap_datalink(handle_);
  if (!options.filter.empty()) {
    struct bpf_program program;
    if (pcap_compile(handle_, &program, options.filter.c_str(), 1, PCAP_NETMASK_UNKNOWN) != 0) {
      *error = fmt::format("bad filter \"{}\": {}", options.filter, pcap_geterr(handle_));
      return false;
    }
    const int set = pcap_setfilter(handle_, &program);
    pcap_freecode(&program);
    if (set != 0) {
      *error = fmt::format("cannot set filter \"{}\": {}", options.filter, pcap_geterr(handle_));
      return false;
    }
  }
  if (live_) {
    if (pcap_setnonblock(handle_, 1, message) != 0) {
      *error = fmt::format("cannot capture on {}: {}", options.interface, message);
      return false;
    }
    fd_ = pcap_get_selectable_fd(handle_);
  }
  return true;
}

PcapSource::Status PcapSource::Dispatch(PacketFn fn, void* context, int timeout_ms,
                                        std::string* error) {
  Callback callback{fn, context, link_type_};
  auto* user = reinterpret_cast<u_char*>(&callback);
  if (live_) {
    if (fd_ >= 0) {
      struct pollfd pfd = {fd_, POLLIN, 0};
      ::poll(&pfd, 1, timeout_ms);  // EINTR (a stop request) simply returns early
    }
    if (pcap_dispatch(handle_, -1, OnPacket, user) < 0) {
      *error = pcap_geterr(handle_);
      return Status::kError;
    }
    return Status::kPackets;
  }
  // A bounded count keeps the caller's stop checks and timers going on a large file.
  const int count = pcap_dispatch(handle_, 4096, OnPacket, user);
  if (count < 0) {
    *error = pcap_geterr(handle_);
    return Status::kError;
  }
  return count == 0 ? Status::kEnd : Status::kPackets;
}

uint64_t PcapSource::Drops() const {
  if (!live_ || handle_ == nullptr) {
    return 0;
  }
  struct pcap_stat stat {};
  if (pcap_stats(handle_, &stat) != 0) {
    return 0;
  }
  return static_cast<uint64_t>(stat.ps_drop) + stat.ps_ifdrop;
}

}  // namespace capture
