#include "tama/agent_config.h"

#include <gtest/gtest.h>
#include <stdlib.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "core/config/cconfig.h"
#include "framework/trace_capture.h"
#include "tama/agent_globals.h"
#include "tama/agent_properties.h"
#include "tests/support/scratch_dir.h"

namespace {

// Points the framework lookups at a temporary home and configuration directory.
class AgentConfigTest : public ::testing::Test {
 protected:
  void SetUp() override {
    root_ = scratch_.path();
    home_ = root_ + "/home/";
    config_dir_ = root_ + "/config/";
    std::filesystem::create_directories(home_);
    std::filesystem::create_directories(config_dir_);
    setenv("Q7_HOME", home_.c_str(), 1);
    setenv("Q7_CONFIG_DIR", config_dir_.c_str(), 1);
    setenv("KQ7_CLASSPATH", "/opt/q7/lib", 1);
    std::strcpy(kq1_short_agent_name, "host");
    std::strcpy(kq1_product_ver, "01.00.00");
    AgentProperties::resetForTesting();
    CConfig::resetForTesting();
  }
  void TearDown() override {
    unsetenv("Q7_HOME");
    unsetenv("Q7_CONFIG_DIR");
    unsetenv("KQ7_CLASSPATH");
    AgentProperties::resetForTesting();
    CConfig::resetForTesting();
  }

  void WriteConfig(const std::string& text) { Write(config_dir_ + "host_q7.cfg", text); }
  void WriteProperties(const std::string& text) {
    Write(config_dir_ + "q7details.properties", text);
  }
  static void Write(const std::string& path, const std::string& text) {
    std::ofstream(path, std::ios::binary) << text;
  }
  static std::string Prop(const char* name) { return AgentProperties::getAgentProperty(name); }

  q7test::ScratchDir scratch_;
  std::string root_;
  std::string home_;
  std::string config_dir_;
};

// Paths are plain concatenations with the directories' own trailing '/'; the fixed properties
// are set and the bundle path goes to the message facility.
TEST_F(AgentConfigTest, BuildsPathsAndFixedProperties) {
  fw::TraceCapture capture;
  readAgentConfig();
  EXPECT_STREQ(home_.c_str(), KTX_MordelDir);
  EXPECT_EQ(home_ + "zorvan6", std::string(KQ1_BaseDir));
  EXPECT_EQ(config_dir_ + "host_q7.cfg", std::string(KQ1_ConfigPath));
  EXPECT_EQ(config_dir_ + "q7details.properties", std::string(KQ1_DetailsPath));
  EXPECT_STREQ("/opt/q7/lib", KQ1_CLASSPATH);
  EXPECT_STREQ("/opt/q7/lib/RTAgentMsgs", RT_BundlePath);
  // The message facility tried that bundle (there is none there).
  EXPECT_TRUE(capture.contains("Could not open resource bundle /opt/q7/lib/RTAgentMsgs"));

  EXPECT_EQ(home_ + "zorvan6", Prop("AgentBaseDir"));
  EXPECT_EQ(config_dir_, Prop("AgentConfigDir"));
  EXPECT_EQ("q7agent Response Time Agent", Prop("AgentType"));
  EXPECT_EQ("01.00.00", Prop("AgentVersion"));
  EXPECT_EQ("/opt/q7/lib", Prop("AgentLibDir"));

  EXPECT_TRUE(capture.contains("OXA base directory = " + home_ + "zorvan6"));
  EXPECT_TRUE(capture.contains("KQ1_DetailsPath = " + config_dir_ + "q7details.properties"));
}

// Configuration entries of the unnamed instance override the properties file and the fixed
// properties, section by section in file order; named instances are not read.
TEST_F(AgentConfigTest, ConfigFileOverridesProperties) {
  WriteProperties("KQ7DPXLOGPATH=/from/properties\nonly_in_file=kept\nAgentType=from file\n");
  WriteConfig(
      "KQ7DPXLOGPATH=/from/config\n"
      "AgentBaseDir=/custom/base\n"
      "[FIRST]\nKQ7OVERTIMEINTERVAL=10\n"
      "[SECOND]\nKQ7OVERTIMEINTERVAL=15\n"
      "[OTHER:FIRST]\nKQ7SUMMARYINTERVAL=99\n");
  fw::TraceCapture capture;
  readAgentConfig();
  EXPECT_EQ("/from/config", Prop("KQ7DPXLOGPATH"));
  EXPECT_EQ("kept", Prop("only_in_file"));
  EXPECT_EQ("q7agent Response Time Agent", Prop("AgentType"));
  EXPECT_EQ("/custom/base", Prop("AgentBaseDir"));
  EXPECT_EQ("15", Prop("KQ7OVERTIMEINTERVAL"));
  EXPECT_EQ("", Prop("KQ7SUMMARYINTERVAL"));
  EXPECT_TRUE(capture.contains("Got config value AgentBaseDir = /custom/base"));
}

// An unparsable or missing configuration file keeps the earlier steps' properties and says so,
// the parser's own text following on the next line.
TEST_F(AgentConfigTest, UnreadableConfigKeepsEarlierProperties) {
  WriteProperties("from_file=1\n");
  for (bool missing : {false, true}) {
    SCOPED_TRACE(missing ? "missing" : "unparsable");
    if (!missing) {
      WriteConfig("good=1\n" + std::string(300, 'v') + "=too long for the parser\n");
    } else {
      std::filesystem::remove(config_dir_ + "host_q7.cfg");
    }
    fw::TraceCapture capture;
    readAgentConfig();
    EXPECT_EQ("1", Prop("from_file"));
    EXPECT_EQ(home_ + "zorvan6", Prop("AgentBaseDir"));
    EXPECT_EQ("", Prop("good"));
    const std::string text =
        "Error: unable to parse config file \"" + config_dir_ + "host_q7.cfg\".";
    std::vector<std::string> lines = capture.lines();
    auto at = std::find_if(lines.begin(), lines.end(), [&](const std::string& line) {
      return line.find(text) != std::string::npos;
    });
    ASSERT_NE(lines.end(), at);
    ASSERT_NE(lines.end(), at + 1);
    EXPECT_NE(std::string::npos, at[1].find("host_q7.cfg")) << at[1];  // the parser's text
  }
}

TEST_F(AgentConfigTest, ConfigWithoutUnnamedInstanceIsReported) {
  WriteConfig("[NAMED:SECTION]\nKQ7OVERTIMEINTERVAL=10\n");
  fw::TraceCapture capture;
  readAgentConfig();
  EXPECT_EQ("", Prop("KQ7OVERTIMEINTERVAL"));
  EXPECT_TRUE(capture.contains("Error: config file syntax error - no instance found\"" +
                               config_dir_ + "host_q7.cfg\"."));
}

// Whole seconds when the text starts with a non-zero integer, else a fraction in milliseconds;
// zero, empty or absent leave the limit unset. Each branch leaves its own trace.
TEST_F(AgentConfigTest, ExcludeOutlierConversions) {
  readAgentConfig();
  fw::TraceCapture capture;
  struct Case {
    const char* value;  // null: property absent
    int millis;
  };
  const std::vector<Case> cases = {
      {"3", 3000},   {"0.25", 250},      {"2.5", 2000},  {"0", -1},   {"", -1},
      {nullptr, -1}, {"3000000", -1000}, {"-0.5", -500}, {"abc", -1}, {"-2", -2000},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.value != nullptr ? c.value : "(absent)");
    CConfig::resetForTesting();
    if (c.value != nullptr) {
      AgentProperties::setAgentProperty("KQ7EXCLUDEOUTLIERSECONDS", c.value);
    } else {
      AgentProperties::removeAgentProperty("KQ7EXCLUDEOUTLIERSECONDS");
    }
    doExcludeOutliers();
    EXPECT_EQ(c.millis, CConfig::getExcludeOutlierMillis());
  }
  EXPECT_TRUE(capture.contains("ExcludeOutlier string found in AgentProperties[3]."));
  EXPECT_TRUE(capture.contains("Setting ExcludeOutlierSeconds to[3]."));
  EXPECT_TRUE(capture.contains(
      "User seems to have given flat for ExcludeOutlierSeconds.  Setting Outlier millis to[250]."));
  EXPECT_TRUE(
      capture.contains("ExcludeOutlierSeconds string converts to 0.  NOT setting CConfig value."));
}

}  // namespace
