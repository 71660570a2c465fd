#include "bench/race_agent.h"

#include <fcntl.h>
#include <httplib.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cctype>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <map>
#include <string_view>
#include <vector>

#include "core/analyzer/situation_controller.h"

namespace bench {
namespace {

using namespace std::chrono_literals;

// The URL is the 23rd '^'-separated field of a record, after its tag.
constexpr int kUrlField = 22;

bool IsObjectRecord(std::string_view record) {
  return record.rfind("<hobj>", 0) == 0 || record.rfind("<audio>", 0) == 0 ||
         record.rfind("<video>", 0) == 0;
}

}  // namespace

std::optional<FinalRecord> FindFinalRecord(const std::string& path) {
  const int fd = ::open(path.c_str(), O_RDONLY);
  if (fd < 0) {
    return std::nullopt;
  }
  struct stat st {};
  ::fstat(fd, &st);
  const size_t size = static_cast<size_t>(st.st_size);
  void* map = size == 0 ? MAP_FAILED : ::mmap(nullptr, size, PROT_READ, MAP_PRIVATE, fd, 0);
  ::close(fd);
  if (map == MAP_FAILED) {
    return std::nullopt;
  }
  const std::string_view text(static_cast<const char*>(map), size);
  std::string_view last = text.substr(0, text.size() - (text.back() == '\n' ? 1 : 0));
  last = last.substr(last.rfind('\n') + 1);
  FinalRecord final;
  final.object = IsObjectRecord(last);
  if (final.object) {
    size_t at = last.find('>') + 1;
    for (int field = 0; field < kUrlField && at != std::string_view::npos; ++field) {
      at = last.find('^', at);
      at = at == std::string_view::npos ? at : at + 1;
    }
    if (at != std::string_view::npos) {
      final.url = std::string(last.substr(at, last.find('^', at) - at));
    }
    // "^URL^" is that URL's field: referers are full URLs and the path is split elsewhere.
    const std::string needle = "^" + final.url + "^";
    const char* from = text.data();
    const char* const end = text.data() + text.size();
    while (const void* found =
               ::memmem(from, static_cast<size_t>(end - from), needle.data(), needle.size())) {
      const size_t hit = static_cast<size_t>(static_cast<const char*>(found) - text.data());
      const size_t line = text.rfind('\n', hit);
      final.url_objects +=
          IsObjectRecord(text.substr(line == std::string_view::npos ? 0 : line + 1)) ? 1 : 0;
      from = static_cast<const char*>(found) + 1;
    }
  }
  ::munmap(map, size);
  return final;
}

bool AgentHome::Prepare(std::string* error, const std::string& extraConfig) {
  std::filesystem::create_directories(home_ + "config");
  std::filesystem::create_directories(home_ + "logs");
  std::filesystem::create_directories(data());
  std::ofstream(home_ + "config/" + q7test::shortHostName() + "_q7.cfg")
      << "[AGENT]\nKQ7DPXLOGPATH=" << data() << "\n"
      << extraConfig;
  CSituationController controller(home_ + "zorvan6/odi/dpx");
  auto pattern = std::make_unique<TransactionPattern>();
  setPatternText(pattern->applicationName, "All");
  setPatternText(pattern->applicationPattern, "*");
  setPatternText(pattern->transactionName, "All");
  setPatternText(pattern->transactionPattern, "*");
  setPatternText(pattern->situationId, "logsrace");
  pattern->aggappsuniq = 1;
  pattern->aggtxsuniq = 1;
  // Instance rows of 10^6 requests would be gigabytes of trace: a race measures aggregation.
  pattern->collectInstances = kCollectNoInstances;
  pattern->mrtthres = 2000;  // slow above 2 s
  if (!controller.addTransactionPattern(std::move(pattern))) {
    *error = "the catch-all transaction pattern was refused";
    return false;
  }
  return true;
}

std::string AgentHome::Start() {
  agent_ = std::make_unique<q7test::AgentProcess>(
      std::vector<std::string>{},
      std::map<std::string, std::string>{{"Q7_HOME", home_},
                                         {"Q7_HTTP_ADDRESS", "127.0.0.1:0"},
                                         {"DPX_NOSTART", "1"},
                                         {"TZ", "UTC"}});
  std::string address;
  const bool up = q7test::waitFor(
      [&] {
        address = q7test::readFile(home_ + "logs/q7agent.addr");
        return !address.empty() && address.back() == '\n';
      },
      20s);
  if (!up) {
    return "";
  }
  address.pop_back();
  return address;
}

bool AgentHome::Stop() {
  agent_->signal(SIGTERM);
  return agent_->wait(15s).has_value();
}

std::string AgentHome::Trace() const {
  return q7test::readFile(home_ + "logs/q7agent.log");
}

std::string AgentHome::ApiToken() const {
  std::string token = q7test::readFile(home_ + "config/q7_api_token");
  while (!token.empty() && std::isspace(static_cast<unsigned char>(token.back()))) {
    token.pop_back();
  }
  return token;
}

nlohmann::json Sample(const std::string& address, const std::string& table,
                      const std::string& query) {
  httplib::Client client("http://" + address);
  client.set_connection_timeout(2);
  client.set_read_timeout(300);
  const auto res = client.Get(("/api/v1/tables/" + table + query).c_str());
  if (!res || res->status != 200) {
    return nullptr;
  }
  return nlohmann::json::parse(res->body, nullptr, false);
}

int64_t SumColumn(const nlohmann::json& sample, const char* column) {
  int64_t sum = 0;
  if (sample.is_object()) {
    for (const nlohmann::json& row : sample["rows"]) {
      sum += row.value(column, int64_t{0});
    }
  }
  return sum;
}

}  // namespace bench
