#include "framework/config_file.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <random>
#include <string>

#include "framework/status.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

// Renders a parsed file as "instance|section|name=value" lines for compact comparison; an empty
// section shows as "instance|section|".
std::string Dump(const ConfigFile& config) {
  std::string out;
  for (const ConfigInstance& instance : config.instances()) {
    for (const ConfigSection& section : instance.sections) {
      if (section.entries.empty()) {
        out += instance.name + "|" + section.name + "|\n";
      }
      for (const ConfigEntry& entry : section.entries) {
        out += instance.name + "|" + section.name + "|" + entry.name + "=" + entry.value + "\n";
      }
    }
  }
  return out;
}

std::string ParseOk(std::string_view text) {
  ConfigFile config;
  std::string error;
  EXPECT_EQ(kOk, ConfigFile::ParseText(text, &config, &error)) << error;
  return Dump(config);
}

// Returns the error of a text that must fail to parse.
std::string ParseFails(std::string_view text) {
  ConfigFile config;
  std::string error;
  EXPECT_EQ(kParseError, ConfigFile::ParseText(text, &config, &error));
  return error;
}

// Instances, sections and entries keep file order; a repeated header reopens its section.
TEST(ConfigFileTest, KeepsOrderOfInstancesSectionsAndEntries) {
  const std::string dump = ParseOk(
      "top=1\n"
      "[MAIN]\n"
      "b = two ; inline comment\n"
      "a=1\n"
      "[inst1:DB]\n"
      "host=x\n"
      "; comment line\n"
      "[EMPTY]\n"
      "[inst1:NET]\n"
      "port=80\n"
      "[MAIN]\n"
      "c=3\n");
  EXPECT_EQ(
      "||top=1\n"
      "|MAIN|b=two\n"
      "|MAIN|a=1\n"
      "|MAIN|c=3\n"
      "|EMPTY|\n"
      "inst1|DB|host=x\n"
      "inst1|NET|port=80\n",
      dump);
}

TEST(ConfigFileTest, HeaderSplitsAtFirstColon) {
  EXPECT_EQ("a|b:c|k=v\n|S|\n", ParseOk("[a:b:c]\nk=v\n[:S]\n"));
}

// A header alone makes its instance exist; a name never mentioned does not.
TEST(ConfigFileTest, FindInstance) {
  ConfigFile config;
  ASSERT_EQ(kOk, ConfigFile::ParseText("[only:SEC]\n", &config, nullptr));
  const ConfigInstance* only = config.FindInstance("only");
  ASSERT_NE(nullptr, only);
  ASSERT_EQ(1u, only->sections.size());
  EXPECT_EQ("SEC", only->sections[0].name);
  EXPECT_EQ(nullptr, config.FindInstance(""));
  EXPECT_EQ(nullptr, config.FindInstance("other"));
}

// An indented line after an entry continues its value, so an indented "[x]" there is no header.
TEST(ConfigFileTest, IndentedBracketAfterEntryIsContinuation) {
  EXPECT_EQ("||a=1\n||a=[x]\n||b=2\n", ParseOk("a=1\n  [x]\nb=2\n"));
  EXPECT_EQ("|x|\n", ParseOk("  [x]\n"));
}

// inih reads 199 characters whole; 200 would be split, so that fails and names its line.
TEST(ConfigFileTest, LineLengthLimit) {
  const std::string value199(197, 'v');
  EXPECT_EQ("|S|k=" + value199 + "\n", ParseOk("[S]\nk=" + value199 + "\r\n"));
  const std::string error = ParseFails("[S]\nok=1\nk=" + value199 + "w\nnext=1\n");
  EXPECT_NE(std::string::npos, error.find("line 3")) << error;
}

TEST(ConfigFileTest, SyntaxErrorsNameTheirLine) {
  EXPECT_NE(std::string::npos, ParseFails("[S]\na=1\nno equals here\n").find("line 3"));
  EXPECT_NE(std::string::npos, ParseFails("a=1\n[unclosed\nb=2\n").find("line 2"));
  EXPECT_NE(std::string::npos, ParseFails("[" + std::string(50, 's') + "]\n").find("line 1"));
  // A long name is whole on its own line, but inih would cut it for a continuation line.
  const std::string name50(50, 'n');
  EXPECT_EQ("|S|" + name50 + "=1\n", ParseOk("[S]\n" + name50 + "=1\n"));
  EXPECT_NE(std::string::npos, ParseFails("[S]\n" + name50 + "=1\n  2\n").find("line 3"));
}

// NUL bytes and random binary junk are parse failures or odd entries, never a crash.
TEST(ConfigFileTest, BinaryJunkDoesNotCrash) {
  const std::string with_nul("[S]\na=1\x00\xff\nb=2\n", 14);
  EXPECT_NE(std::string::npos, ParseFails(with_nul).find("line 2"));

  std::mt19937 random(7);
  for (int round = 0; round < 500; ++round) {
    std::string junk(random() % 600, '\0');
    for (char& c : junk) {
      const unsigned r = random() % 8;
      c = r == 0 ? '\n' : r == 1 ? '[' : r == 2 ? '=' : static_cast<char>(random());
    }
    ConfigFile config;
    const int rc = ConfigFile::ParseText(junk, &config, nullptr);
    EXPECT_TRUE(rc == kOk || rc == kParseError);
  }
}

class ConfigFileDiskTest : public ::testing::Test {
 protected:
  void SetUp() override { dir_ = scratch_.path(); }

  q7test::ScratchDir scratch_;
  std::string dir_;
};

TEST_F(ConfigFileDiskTest, ParsesFileAndNamesItInErrors) {
  const std::string path = dir_ + "/agent.cfg";
  std::ofstream(path) << "[inst:S]\nk=v\n";
  ConfigFile config;
  std::string error;
  ASSERT_EQ(kOk, ConfigFile::Parse(path, &config, &error)) << error;
  EXPECT_EQ("inst|S|k=v\n", Dump(config));

  std::ofstream(path) << "[S]\nbroken\n";
  EXPECT_EQ(kParseError, ConfigFile::Parse(path, &config, &error));
  EXPECT_NE(std::string::npos, error.find(path)) << error;
  EXPECT_NE(std::string::npos, error.find("line 2")) << error;
}

TEST_F(ConfigFileDiskTest, UnreadableFileIsIoError) {
  ConfigFile config;
  std::string error;
  const std::string missing = dir_ + "/missing.cfg";
  EXPECT_EQ(kIoError, ConfigFile::Parse(missing, &config, &error));
  EXPECT_NE(std::string::npos, error.find(missing)) << error;
  EXPECT_NE(std::string::npos, error.find("No such file")) << error;
  EXPECT_EQ(kIoError, ConfigFile::Parse(dir_, &config, &error));
  EXPECT_NE(std::string::npos, error.find("Is a directory")) << error;
}

}  // namespace
}  // namespace fw
