#include "core/analyzer/situation_controller.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#include "core/runtime/misc.h"
#include "framework/trace_capture.h"

namespace {

std::unique_ptr<TransactionPattern> Tx(const char* situation, const char* app, const char* tx,
                                       int percent = 100) {
  auto p = std::make_unique<TransactionPattern>();
  setPatternText(p->situationId, situation);
  setPatternText(p->applicationPattern, app);
  setPatternText(p->transactionPattern, tx);
  setPatternText(p->applicationName, "App");
  p->samplePercent = percent;
  p->mrtthres = 1500;
  return p;
}

std::unique_ptr<ClientPattern> Client(const char* situation, const char* host, const char* ip) {
  auto p = std::make_unique<ClientPattern>();
  setPatternText(p->situationId, situation);
  setPatternText(p->hostNamePattern, host);
  setPatternText(p->ipAddressPattern, ip);
  return p;
}

class SituationControllerTest : public testing::Test {
 protected:
  void SetUp() override {
    char dir[] = "/tmp/q7-situations-XXXXXX";
    ASSERT_NE(nullptr, mkdtemp(dir));
    dir_ = dir;
    controller_ = std::make_unique<CSituationController>(dir_);
  }
  void TearDown() override { std::filesystem::remove_all(dir_); }

  // Situation IDs of the taken transaction patterns, in result order.
  std::string Match(const char* app, const char* tx, bool all, bool sample) {
    return Ids(controller_->matchTransactionPatterns(app, tx, all, sample));
  }
  std::string MatchClient(const char* host, const char* ip, bool all) {
    return Ids(controller_->matchClientPatterns(host, ip, all));
  }
  template <typename Node>
  static std::string Ids(Node* list) {
    std::string ids;
    for (Node* n = list; n != nullptr; n = n->next) {
      ids += std::string(ids.empty() ? "" : ",") + n->pattern.situationId;
    }
    if constexpr (std::is_same_v<Node, TransactionMatch>) {
      CSituationController::freeTransactionMatches(list);
    } else {
      CSituationController::freeClientMatches(list);
    }
    return ids;
  }
  std::string StoredOrder(const CSituationController& c) const {
    std::string ids;
    for (const TransactionPattern& p : c.getTransactionPatterns()) {
      ids += std::string(ids.empty() ? "" : ",") + p.situationId;
    }
    return ids;
  }
  // Stands in for time passing: marks a file as changed after everything written so far.
  void Touch(const char* name) const {
    const timespec times[2] = {{0, UTIME_OMIT}, {time(nullptr) + 60 + ++touches_, 0}};
    ASSERT_EQ(0, utimensat(AT_FDCWD, (dir_ + "/" + name).c_str(), times, 0));
  }

  std::string dir_;
  mutable int touches_ = 0;
  std::unique_ptr<CSituationController> controller_;
};

// ---- Matching. ----

// Sampling takes a share of the matches, counting from the pattern's first match.
TEST_F(SituationControllerTest, SamplingTakesTheShareAskedFor) {
  for (const auto& [percent, expected] : std::vector<std::pair<int, std::string>>{
           {50, "010101"}, {100, "111111"}, {0, "000000"}, {-5, "000000"}}) {
    controller_->removeTransactionPatterns("s");
    ASSERT_TRUE(controller_->addTransactionPattern(Tx("s", "*", "*", percent)));
    std::string taken;
    for (int i = 0; i < 6; ++i) {
      taken += Match("app", "/x", false, true).empty() ? "0" : "1";
    }
    EXPECT_EQ(expected, taken) << percent << " %";
    EXPECT_EQ(6u, controller_->getTransactionPatterns()[0].matchedCount);
  }
  EXPECT_EQ("s", Match("app", "/x", false, false));  // without sampling, always taken
}

// The walk stops at the first pattern that matches even when sampling passes it over.
// The index in front of matching must find what the literal ordered scan finds: random patterns
// over a small alphabet (so that prefixes, suffixes and fixed texts collide), with case, '*' in
// every position and characters ICU folds onto ASCII (the Kelvin sign, long s), against random
// names, including ones that are not ASCII; and again after removals and a reload.
TEST_F(SituationControllerTest, IndexedMatchingAgreesWithTheOrderedScan) {
  const std::vector<std::string> patternParts = {
      "a", "A", "b", "ab", "/", ".", "*", "*", "\xe2\x84\xaa", "\xc5\xbf", "k", "s"};
  const std::vector<std::string> textParts = {"a", "B", "b", "/", ".", "k", "K", "s", "\xc3\xa9"};
  std::srand(19);
  const auto random = [](const std::vector<std::string>& parts, int most) {
    std::string text;
    for (int n = std::rand() % (most + 1); n > 0; --n) {
      text += parts[static_cast<size_t>(std::rand()) % parts.size()];
    }
    return text;
  };
  for (int i = 0; i < 150; ++i) {
    const std::string id = "s" + std::to_string(i % 40);
    const std::string app = random(patternParts, 4);
    const std::string tx = random(patternParts, 5);
    controller_->addTransactionPattern(Tx(id.c_str(), app.empty() ? "*" : app.c_str(), tx.c_str()));
    controller_->addClientPattern(Client(id.c_str(), app.c_str(), tx.c_str()));
  }
  const auto expect = [](const auto& patterns, const char* first, const char* second, bool all,
                         auto firstOf, auto secondOf) {
    std::string ids;
    for (const auto& p : patterns) {
      if (CCommon::patternMatches(firstOf(p), first) &&
          CCommon::patternMatches(secondOf(p), second)) {
        ids += std::string(ids.empty() ? "" : ",") + p.situationId;
        if (!all) {
          break;
        }
      }
    }
    return ids;
  };
  const auto check = [&](const CSituationController& c, int rounds) {
    const std::vector<TransactionPattern> txs = c.getTransactionPatterns();
    const std::vector<ClientPattern> clients = c.getClientPatterns();
    ASSERT_FALSE(txs.empty());
    for (int r = 0; r < rounds; ++r) {
      const std::string a = random(textParts, 4);
      const std::string b = random(textParts, 6);
      for (const bool all : {false, true}) {
        ASSERT_EQ(expect(
                      txs, a.c_str(), b.c_str(), all,
                      [](const TransactionPattern& p) { return p.applicationPattern; },
                      [](const TransactionPattern& p) { return p.transactionPattern; }),
                  Match(a.c_str(), b.c_str(), all, false))
            << "[" << a << "] [" << b << "] all=" << all;
        ASSERT_EQ(expect(
                      clients, a.c_str(), b.c_str(), all,
                      [](const ClientPattern& p) { return p.hostNamePattern; },
                      [](const ClientPattern& p) { return p.ipAddressPattern; }),
                  MatchClient(a.c_str(), b.c_str(), all))
            << "[" << a << "] [" << b << "] all=" << all;
      }
    }
  };
  check(*controller_, 1500);
  for (int i = 0; i < 40; i += 3) {
    controller_->removeTransactionPatterns(("s" + std::to_string(i)).c_str());
    controller_->removeClientPatterns(("s" + std::to_string(i)).c_str());
  }
  check(*controller_, 600);
  // A reload replaces the patterns the index was built over.
  controller_ = std::make_unique<CSituationController>(dir_);
  controller_->loadPatternsIfNewer();
  check(*controller_, 600);
}

TEST_F(SituationControllerTest, FirstMatchOnlyStopsAtAnUntakenMatch) {
  controller_->addTransactionPattern(Tx("half", "*", "/shop/*", 50));
  controller_->addTransactionPattern(Tx("all", "*", "*"));
  EXPECT_EQ("", Match("app", "/shop/a", false, true));
  EXPECT_EQ(0u, controller_->getTransactionPatterns()[1].matchedCount);
  EXPECT_EQ("half,all", Match("app", "/shop/a", true, true));
  EXPECT_EQ("all", Match("app", "/home", false, true));
  EXPECT_EQ("", Match("app", nullptr, true, false));
}

// Longer combined patterns come first; equal keys keep the order they were added in.
TEST_F(SituationControllerTest, LongerPatternsFirstAndEqualKeysStable) {
  controller_->addTransactionPattern(Tx("short", "*", "*"));
  controller_->addTransactionPattern(Tx("tie1", "*", "*p"));
  controller_->addTransactionPattern(Tx("long", "/shop*", "*.jsp"));
  controller_->addTransactionPattern(Tx("tie2", "/*", "*"));
  EXPECT_EQ("long,tie1,tie2,short", StoredOrder(*controller_));
  EXPECT_EQ(11, controller_->getTransactionPatterns()[0].orderingKey);
  EXPECT_EQ("tie1", Match("/app", "/ap", false, false));
  EXPECT_EQ("long,tie1,tie2,short", Match("/shopx", "/a.jsp", true, false));
}

TEST_F(SituationControllerTest, ClientPatternsFirstAddedWins) {
  controller_->addClientPattern(Client("wide", "*", "10.*"));
  controller_->addClientPattern(Client("narrow", "web*", "10.1.*"));
  EXPECT_EQ("wide", MatchClient("WEB1", "10.1.2.3", false));
  EXPECT_EQ("wide,narrow", MatchClient("web1", "10.1.2.3", true));
  EXPECT_EQ("", MatchClient("web1", "192.168.0.1", true));
}

// ---- Registering and removing. ----

TEST_F(SituationControllerTest, PatternsThatMatchNothingAreRefused) {
  for (const char* never : {"", "**"}) {
    auto pattern = Tx("s", "*", never);
    EXPECT_FALSE(controller_->addTransactionPattern(std::move(pattern)));
    EXPECT_NE(nullptr, pattern) << "a refused pattern stays with the caller";
    EXPECT_FALSE(controller_->addClientPattern(Client("s", never, "*")));
  }
  EXPECT_EQ(0, controller_->getTransactionPatternCount() + controller_->getClientPatternCount());
}

// A text cut to its field never ends inside a UTF-8 character.
TEST_F(SituationControllerTest, LongTextIsCutAtACharacterBoundary) {
  TransactionPattern p;
  setPatternText(p.applicationName, (std::string(127, 'a') + "\xc3\xa9").c_str());
  EXPECT_EQ(std::string(127, 'a'), p.applicationName);
  setPatternText(p.applicationName, (std::string(126, 'a') + "\xc3\xa9").c_str());
  EXPECT_EQ(128u, strlen(p.applicationName));
}

TEST_F(SituationControllerTest, RemoveTakesEveryPatternOfTheSituation) {
  controller_->addTransactionPattern(Tx("a", "*", "/1"));
  controller_->addTransactionPattern(Tx("b", "*", "/2"));
  controller_->addTransactionPattern(Tx("a", "*", "/3"));
  controller_->addClientPattern(Client("a", "*", "*"));
  EXPECT_EQ(2, controller_->removeTransactionPatterns("a"));
  EXPECT_EQ(0, controller_->removeTransactionPatterns("a"));
  EXPECT_EQ("b", StoredOrder(*controller_));
  EXPECT_EQ(1, controller_->getClientPatternCount());
  EXPECT_EQ(1, controller_->removeClientPatterns("a"));
}

// The overlap reported is the first stored pattern in matching order, decided on both parts.
TEST_F(SituationControllerTest, OverlapNamesTheFirstOverlappingPattern) {
  controller_->addTransactionPattern(Tx("any", "*", "*"));
  controller_->addTransactionPattern(Tx("jsp", "/shop*", "*.jsp"));
  auto found = controller_->findOverlappingTransactionPattern(*Tx("new", "*", "/x/*.JSP"));
  ASSERT_TRUE(found.has_value());
  EXPECT_STREQ("jsp", found->situationId);
  controller_->removeTransactionPatterns("any");
  EXPECT_FALSE(controller_->findOverlappingTransactionPattern(*Tx("new", "*", "*.gif")));
  EXPECT_FALSE(controller_->findOverlappingTransactionPattern(*Tx("new", "/home*", "*.jsp")));

  controller_->addClientPattern(Client("c", "*", "10.*"));
  EXPECT_TRUE(controller_->findOverlappingClientPattern(*Client("n", "web*", "10.1.*")));
  EXPECT_FALSE(controller_->findOverlappingClientPattern(*Client("n", "web*", "192.*")));
}

// ---- Persistence. ----

TEST_F(SituationControllerTest, AnotherControllerLoadsThePatternsInOrder) {
  controller_->addTransactionPattern(Tx("short", "*", "*"));
  controller_->addTransactionPattern(Tx("long", "/shop*", "*.jsp", 25));
  controller_->addClientPattern(Client("c2", "b*", "*"));
  controller_->addClientPattern(Client("c1", "a*", "*"));
  Match("/shop", "/a.jsp", true, false);

  CSituationController reloaded(dir_ + "/");
  EXPECT_EQ(2, reloaded.loadPatternsIfNewer());
  EXPECT_EQ("long,short", StoredOrder(reloaded));
  const TransactionPattern first = reloaded.getTransactionPatterns()[0];
  EXPECT_STREQ("*.jsp", first.transactionPattern);
  EXPECT_EQ(25, first.samplePercent);
  EXPECT_EQ(1500, first.mrtthres);
  EXPECT_EQ(0u, first.matchedCount);
  EXPECT_STREQ("c2", reloaded.getClientPatterns()[0].situationId);
  EXPECT_EQ("c2", Ids(reloaded.matchClientPatterns("b1", "1.2.3.4", false)));
}

// Reading back our own write would zero the counters; it must not happen.
TEST_F(SituationControllerTest, OwnWriteIsNotReadBack) {
  controller_->addTransactionPattern(Tx("s", "*", "*"));
  Match("a", "b", false, false);
  EXPECT_EQ(0, controller_->loadPatternsIfNewer());
  EXPECT_EQ(1u, controller_->getTransactionPatterns()[0].matchedCount);
}

TEST_F(SituationControllerTest, NewerFileFromAnotherWriterIsPickedUp) {
  controller_->addTransactionPattern(Tx("mine", "*", "*"));
  CSituationController other(dir_);
  other.loadPatternsIfNewer();
  other.addTransactionPattern(Tx("theirs", "*", "/other/*"));
  Touch("tpatterns.dat");
  EXPECT_EQ(1, controller_->loadPatternsIfNewer());
  EXPECT_EQ("theirs,mine", StoredOrder(*controller_));
  EXPECT_EQ(0, controller_->loadPatternsIfNewer());
}

// A damaged file leaves the patterns alone and is set aside, named in the trace; a file without
// records empties them.
TEST_F(SituationControllerTest, DamagedFileKeepsPatternsEmptyFileClearsThem) {
  controller_->addTransactionPattern(Tx("s", "*", "*"));
  const std::string path = dir_ + "/tpatterns.dat";
  long long size = 0;
  ASSERT_TRUE(CMisc::getFileSize64(path.c_str(), &size));
  EXPECT_EQ(4 + 1044, size);

  ASSERT_EQ(0, CMisc::truncateFile(path.c_str(), static_cast<unsigned long>(size - 10)));
  Touch("tpatterns.dat");
  {
    fw::TraceCapture capture("*=ALL");
    EXPECT_EQ(0, controller_->loadPatternsIfNewer());
    EXPECT_TRUE(capture.contains("Pattern file " + path + " does not load"));
  }
  EXPECT_EQ(1, controller_->getTransactionPatternCount());
  EXPECT_FALSE(std::filesystem::exists(path));
  EXPECT_TRUE(std::filesystem::exists(path + ".bad"));

  FILE* f = fopen(path.c_str(), "wb");
  const uint32_t words[2] = {2, 0};  // a future format version
  ASSERT_EQ(1u, fwrite(words, sizeof(words), 1, f));
  fclose(f);
  Touch("tpatterns.dat");
  EXPECT_EQ(0, controller_->loadPatternsIfNewer());
  EXPECT_EQ(1, controller_->getTransactionPatternCount());

  EXPECT_FALSE(std::filesystem::exists(path));
  std::ofstream(path, std::ios::trunc);
  Touch("tpatterns.dat");
  EXPECT_EQ(1, controller_->loadPatternsIfNewer());
  EXPECT_EQ(0, controller_->getTransactionPatternCount());
}

TEST_F(SituationControllerTest, MissingDirectoryIsCreatedAtFirstWrite) {
  CSituationController nested(dir_ + "/a/b");
  ASSERT_TRUE(nested.addClientPattern(Client("s", "*", "*")));
  CSituationController reloaded(dir_ + "/a/b");
  EXPECT_EQ(1, reloaded.loadPatternsIfNewer());
}

// Situations come and go while the analyzer matches and the tables take snapshots.
TEST_F(SituationControllerTest, ConcurrentUseRunsClean) {
  std::vector<std::thread> threads;
  for (int t = 0; t < 2; ++t) {
    threads.emplace_back([this, t] {
      const std::string id = "s" + std::to_string(t);
      for (int i = 0; i < 20; ++i) {
        controller_->addTransactionPattern(Tx(id.c_str(), "*", i % 2 ? "/a*" : "*", 50));
        controller_->addClientPattern(Client(id.c_str(), "*", "10.*"));
        if (i % 5 == 4) {
          controller_->removeTransactionPatterns(id.c_str());
          controller_->removeClientPatterns(id.c_str());
        }
      }
    });
    threads.emplace_back([this] {
      for (int i = 0; i < 200; ++i) {
        Match("app", "/a/b", i % 2 == 0, true);
        MatchClient("h", "10.0.0.1", true);
        controller_->getTransactionPatterns();
        controller_->loadPatternsIfNewer();
      }
    });
  }
  for (std::thread& t : threads) {
    t.join();
  }
  EXPECT_EQ(0, controller_->getTransactionPatternCount());
  CSituationController reloaded(dir_);
  reloaded.loadPatternsIfNewer();
  EXPECT_EQ(0, reloaded.getTransactionPatternCount() + reloaded.getClientPatternCount());
}

}  // namespace
