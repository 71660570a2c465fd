#include "framework/environment.h"

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>
#include <fstream>
#include <map>
#include <optional>
#include <string>

#include "framework/status.h"
#include "tests/support/scratch_dir.h"

namespace fw {
namespace {

// Points the configuration directory at a temporary folder and hides the variables the tests
// use; everything comes back afterwards.
class EnvironmentTest : public ::testing::Test {
 protected:
  void SetUp() override {
    for (const char* name : {"Q7_HOME", "Q7_CONFIG_DIR", "KQ7_CLASSPATH", "Q7FW_A", "Q7FW_B",
                             "Q7FW_C", "Q7FW_D", "Q7FW_E", "Q7FW_F", "Q7FW_G"}) {
      const char* value = getenv(name);
      saved_[name] = value ? std::optional<std::string>(value) : std::nullopt;
      unsetenv(name);
    }
    dir_ = scratch_.path();
    setenv("Q7_CONFIG_DIR", dir_.c_str(), 1);
  }
  void TearDown() override {
    for (const auto& [name, value] : saved_) {
      if (value) {
        setenv(name.c_str(), value->c_str(), 1);
      } else {
        unsetenv(name.c_str());
      }
    }
  }

  void WriteEnvFile(const std::string& text) {
    std::ofstream(dir_ + "/q7.env", std::ios::binary) << text;
  }

  static std::optional<std::string> Lookup(const char* name) {
    std::string value;
    if (!GetEnv(name, &value)) {
      return std::nullopt;
    }
    return value;
  }

  q7test::ScratchDir scratch_;
  std::string dir_;

 private:
  std::map<std::string, std::optional<std::string>> saved_;
};

// The test binary lives in the build's bin/ folder, so home is the build folder.
TEST_F(EnvironmentTest, DirectoriesDefaultBesideExecutable) {
  const std::string exe_dir = ExecutableDirectory();
  ASSERT_TRUE(std::filesystem::exists(exe_dir + "framework_test")) << exe_dir;
  ASSERT_GE(exe_dir.size(), 5u);
  ASSERT_EQ("/bin/", exe_dir.substr(exe_dir.size() - 5));
  const std::string build_dir = exe_dir.substr(0, exe_dir.size() - 4);

  unsetenv("Q7_CONFIG_DIR");
  std::string home;
  std::string config;
  ASSERT_EQ(kOk, GetHomeDirectory(&home));
  ASSERT_EQ(kOk, GetConfigDirectory(&config));
  EXPECT_EQ(build_dir, home);
  EXPECT_EQ(build_dir + "config/", config);
  EXPECT_EQ(build_dir + "lib", Lookup("KQ7_CLASSPATH"));
}

TEST_F(EnvironmentTest, DirectoryVariablesGainTrailingSlash) {
  setenv("Q7_HOME", "/opt/q7", 1);
  unsetenv("Q7_CONFIG_DIR");
  std::string dir;
  ASSERT_EQ(kOk, GetHomeDirectory(&dir));
  EXPECT_EQ("/opt/q7/", dir);
  ASSERT_EQ(kOk, GetConfigDirectory(&dir));
  EXPECT_EQ("/opt/q7/config/", dir);
  setenv("Q7_CONFIG_DIR", "/etc/q7/", 1);
  ASSERT_EQ(kOk, GetConfigDirectory(&dir));
  EXPECT_EQ("/etc/q7/", dir);
}

// q7.env syntax: comments, blanks, quotes, the last of two definitions; junk lines are skipped.
TEST_F(EnvironmentTest, ReadsEnvFile) {
  WriteEnvFile(
      "# a comment\n"
      "   # an indented comment\n"
      "\n"
      "Q7FW_A=plain\n"
      "  Q7FW_B  =   spaced out  \r\n"
      "Q7FW_C=\"  quoted = kept  \"\n"
      "no equals sign\n"
      "=no name\n"
      "BAD NAME=x\n"
      "Q7FW_D=first\n"
      "Q7FW_D=second\n"
      "Q7FW_E=\n"
      "Q7FW_F=\"unbalanced\n"
      "#Q7FW_G=commented\n"
      "\x01\xff\xfe junk\n"
      "Q7FW_G=after junk");
  EXPECT_EQ("plain", Lookup("Q7FW_A"));
  EXPECT_EQ("spaced out", Lookup("Q7FW_B"));
  EXPECT_EQ("  quoted = kept  ", Lookup("Q7FW_C"));
  EXPECT_EQ("second", Lookup("Q7FW_D"));
  EXPECT_EQ("", Lookup("Q7FW_E"));
  EXPECT_EQ("\"unbalanced", Lookup("Q7FW_F"));
  EXPECT_EQ("after junk", Lookup("Q7FW_G"));
  EXPECT_EQ(std::nullopt, Lookup("Q7FW_MISSING"));
  EXPECT_EQ(std::nullopt, Lookup("BAD"));
  EXPECT_EQ(std::nullopt, Lookup(""));
}

// The process environment wins over q7.env, even with an empty value.
TEST_F(EnvironmentTest, ProcessEnvironmentWins) {
  WriteEnvFile("Q7FW_A=file\nQ7FW_B=file\nKQ7_CLASSPATH=/from/file\n");
  setenv("Q7FW_A", "process", 1);
  setenv("Q7FW_B", "", 1);
  EXPECT_EQ("process", Lookup("Q7FW_A"));
  EXPECT_EQ("", Lookup("Q7FW_B"));
  EXPECT_EQ("/from/file", Lookup("KQ7_CLASSPATH"));
  setenv("KQ7_CLASSPATH", "/from/env", 1);
  EXPECT_EQ("/from/env", Lookup("KQ7_CLASSPATH"));
}

// No q7.env, or one that cannot be read as a file, is not an error.
TEST_F(EnvironmentTest, MissingOrUnreadableEnvFile) {
  EXPECT_EQ(std::nullopt, Lookup("Q7FW_A"));
  ASSERT_EQ(0, mkdir((dir_ + "/q7.env").c_str(), 0755));
  EXPECT_EQ(std::nullopt, Lookup("Q7FW_A"));
  EXPECT_TRUE(Lookup("KQ7_CLASSPATH").has_value());
}

}  // namespace
}  // namespace fw
