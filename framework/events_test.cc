// Data events: the per-table rings, subscriptions, and the /api/v1/events endpoints on a real
// server, including the end of open streams when the server stops.

#include "framework/events.h"

#include <gtest/gtest.h>
#include <httplib.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstring>
#include <future>
#include <memory>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "framework/events_api.h"
#include "framework/http_server.h"
#include "framework/status.h"
#include "framework/tables.h"
#include "tests/support/test_util.h"

namespace fw {
namespace {

using namespace std::chrono_literals;

struct Note {
  char text[8];
  std::int32_t number;
};

Note MakeNote(const char* text, std::int32_t number) {
  Note note;
  std::memset(note.text, ' ', sizeof(note.text));
  std::memcpy(note.text, text, std::min(std::strlen(text), sizeof(note.text)));
  note.number = number;
  return note;
}

std::int32_t NumberOf(const EventRow& row) {
  Note note;
  std::memcpy(&note, row.bytes.data(), sizeof(note));
  return note.number;
}

class NullManager : public TableManager {
 public:
  std::unique_ptr<TableAgent> CreateAgent(Request*) override { return nullptr; }
  void EventArrived(Request&) override {}
  void AddDataToEvent(Request&, const void*, int) override {}
};

class EventsTest : public ::testing::Test {
 protected:
  void SetUp() override { ResetEventsForTesting(); }
  void TearDown() override { ResetEventsForTesting(); }

  static void Push(const char* table, std::int32_t number) {
    const Note note = MakeNote("n", number);
    ASSERT_EQ(kOk, PushEventRows(table, &note, sizeof(note), 1));
  }
};

// The ring keeps the last 1000 rows of its table, oldest first, apart from other tables.
TEST_F(EventsTest, RingKeepsTheLastThousandPerTable) {
  for (int i = 1; i <= 1005; ++i) {
    Push("NOTES", i);
  }
  Push("other", -1);
  const std::vector<EventRow> notes = ListEventRows("notes");
  ASSERT_EQ(kEventRingCapacity, notes.size());
  EXPECT_EQ(6, NumberOf(notes.front()));
  EXPECT_EQ(1005, NumberOf(notes.back()));
  ASSERT_EQ(1u, ListEventRows("OTHER").size());
  EXPECT_TRUE(ListEventRows("NEVER").empty());

  const std::vector<EventRow> all = ListAllEventRows();
  ASSERT_EQ(kEventRingCapacity + 1, all.size());
  EXPECT_EQ(6, NumberOf(all.front()));
  EXPECT_EQ(-1, NumberOf(all.back()));
  EXPECT_EQ("other", all.back().table);
}

TEST_F(EventsTest, RefusesUnusableRows) {
  const Note note = MakeNote("x", 1);
  EXPECT_EQ(kInvalidArgument, PushEventRows("", &note, sizeof(note), 1));
  EXPECT_EQ(kInvalidArgument, PushEventRows("NOTES", nullptr, sizeof(note), 1));
  EXPECT_EQ(kInvalidArgument, PushEventRows("NOTES", &note, 0, 1));
  EXPECT_EQ(kInvalidArgument, PushEventRows("NOTES", &note, sizeof(note), 0));
  EXPECT_TRUE(ListAllEventRows().empty());
}

// A subscription sees rows pushed after it was taken, from any thread; Close wakes a waiter.
TEST_F(EventsTest, SubscriptionGetsLaterRowsUntilClosed) {
  Push("NOTES", 1);
  std::shared_ptr<EventSubscription> subscription = SubscribeEvents();
  std::thread pusher([] { Push("NOTES", 2); });
  EventRow row;
  ASSERT_TRUE(subscription->Next(&row, 5s));
  EXPECT_EQ(2, NumberOf(row));
  pusher.join();
  EXPECT_FALSE(subscription->Next(&row, 10ms));

  auto waiter = std::async(std::launch::async, [&] { return subscription->Next(&row, 10s); });
  std::this_thread::sleep_for(20ms);
  subscription->Close();
  ASSERT_EQ(std::future_status::ready, waiter.wait_for(2s));
  EXPECT_FALSE(waiter.get());
  Push("NOTES", 3);
  EXPECT_FALSE(subscription->Next(&row, 0ms));
}

// The endpoints on a real server, with a registered table to describe the rows.
class EventsEndpointTest : public EventsTest {
 protected:
  void SetUp() override {
    EventsTest::SetUp();
    ResetTablesForTesting();
    TableDefinition table{"NOTES",
                          {{"text", kColumnTypeString, 8, 0},
                           {"number", kColumnTypeInt32, 4, static_cast<int>(sizeof(char[8]))}},
                          sizeof(Note),
                          std::make_unique<NullManager>(),
                          {},
                          false};
    ASSERT_EQ(kOk, RegisterTable(std::move(table)));
    std::string error;
    ASSERT_EQ(kOk, server_.Start("127.0.0.1:0", &error)) << error;
  }
  void TearDown() override {
    server_.Stop();
    ResetTablesForTesting();
    EventsTest::TearDown();
  }

  std::unique_ptr<httplib::Client> Client() {
    auto client = std::make_unique<httplib::Client>("http://" + server_.bound_address());
    client->set_read_timeout(10, 0);
    return client;
  }

  // What a stream client saw: the status, everything received, and whether the stream ended
  // with its closing chunk rather than a broken connection.
  struct StreamResult {
    int status = -1;
    std::string body;
    bool clean_end = false;
  };

  // Opens a stream on a thread of its own. *opened is set once the answer's status is known
  // (the subscription exists by then).
  // Reads the stream until it ends; *received (when given) follows the bytes received so far.
  std::future<StreamResult> OpenStream(std::promise<int>* opened,
                                       std::atomic<size_t>* received = nullptr) {
    return std::async(std::launch::async, [this, opened, received] {
      auto client = Client();
      std::string body;
      int status = -1;
      auto res = client->Get(
          "/api/v1/events/stream",
          [&](const httplib::Response& response) {
            status = response.status;
            opened->set_value(status);
            return true;
          },
          [&](const char* data, std::size_t length) {
            body.append(data, length);
            if (received != nullptr) {
              received->store(body.size());
            }
            return true;
          });
      if (status == -1) {
        status = res ? res->status : -1;
        opened->set_value(status);
      }
      return StreamResult{status, body, static_cast<bool>(res)};
    });
  }

  HttpServer server_;
};

TEST_F(EventsEndpointTest, ListsRowsAsJsonWithLimit) {
  Push("NOTES", 1);
  Push("NOTES", 2);
  Push("NOTES", 3);
  auto res = Client()->Get("/api/v1/events?limit=2");
  ASSERT_TRUE(res);
  ASSERT_EQ(200, res->status);
  EXPECT_EQ(nlohmann::json::parse(R"({"events": [{"text": "n", "number": 2},
                                                 {"text": "n", "number": 3}]})"),
            nlohmann::json::parse(res->body));
  res = Client()->Get("/api/v1/events");
  ASSERT_TRUE(res);
  EXPECT_EQ(3u, nlohmann::json::parse(res->body)["events"].size());
  res = Client()->Get("/api/v1/events?limit=x");
  ASSERT_TRUE(res);
  EXPECT_EQ(400, res->status);
}

// A stream delivers a row pushed after it opened, and ends cleanly when the server stops.
TEST_F(EventsEndpointTest, StreamDeliversRowsAndEndsOnStop) {
  std::promise<int> opened;
  std::atomic<size_t> received{0};
  auto stream = OpenStream(&opened, &received);
  ASSERT_EQ(200, opened.get_future().get());
  Push("NOTES", 42);

  // The row reaches the client before the stop; the stop itself must not wait for the client.
  ASSERT_TRUE(q7test::PollUntil([&] { return received.load() > 0; }, 5s));
  const auto stopping = std::chrono::steady_clock::now();
  server_.Stop();
  EXPECT_LT(std::chrono::steady_clock::now() - stopping, 2s);
  ASSERT_EQ(std::future_status::ready, stream.wait_for(2s));
  const StreamResult result = stream.get();
  EXPECT_EQ(200, result.status);
  EXPECT_EQ("data: {\"text\":\"n\",\"number\":42}\n\n", result.body);
  EXPECT_TRUE(result.clean_end);
}

// Streams hold worker threads, so only a few may be open; the next one is refused.
TEST_F(EventsEndpointTest, CapsOpenStreams) {
  std::vector<std::promise<int>> opened(kMaxEventStreams + 1);
  std::vector<std::future<StreamResult>> streams;
  for (int i = 0; i < kMaxEventStreams; ++i) {
    streams.push_back(OpenStream(&opened[i]));
    ASSERT_EQ(200, opened[i].get_future().get());
  }
  streams.push_back(OpenStream(&opened[kMaxEventStreams]));
  EXPECT_EQ(503, opened[kMaxEventStreams].get_future().get());
  // The plain endpoints still answer.
  auto res = Client()->Get("/api/v1/events");
  ASSERT_TRUE(res);
  EXPECT_EQ(200, res->status);
  server_.Stop();
  for (auto& stream : streams) {
    EXPECT_EQ(std::future_status::ready, stream.wait_for(2s));
  }
}

}  // namespace
}  // namespace fw
