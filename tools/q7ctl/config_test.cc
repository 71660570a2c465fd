// Where q7ctl looks for the agent's address and token, against a scratch home and a fake
// environment.

#include "tools/q7ctl/config.h"

#include <gtest/gtest.h>

#include <map>
#include <string>

#include "tests/support/scratch_dir.h"

namespace q7ctl {
namespace {

class ConfigTest : public ::testing::Test {
 protected:
  ConfigTest() {
    env_.get = [this](const std::string& name) -> std::optional<std::string> {
      const auto it = vars_.find(name);
      return it == vars_.end() ? std::nullopt : std::optional<std::string>(it->second);
    };
    // As if installed in <scratch>/bin/q7ctl, with no Q7_HOME.
    env_.executable_dir = scratch_.path() + "/bin/";
  }

  std::string home() const { return scratch_.path() + "/"; }

  std::string Address() {
    std::string address, error;
    EXPECT_TRUE(ResolveAddress(env_, &address, &error)) << error;
    return address;
  }

  q7test::ScratchDir scratch_;
  std::map<std::string, std::string> vars_;
  Environment env_;
};

// The home is the parent of bin/ unless Q7_HOME names one; the config dir follows the home.
TEST_F(ConfigTest, DirectoriesFollowTheAgentsRules) {
  EXPECT_EQ(home(), HomeDirectory(env_));
  EXPECT_EQ(home() + "config/", ConfigDirectory(env_));
  vars_["Q7_HOME"] = "/opt/q7";
  EXPECT_EQ("/opt/q7/", HomeDirectory(env_));
  EXPECT_EQ("/opt/q7/config/", ConfigDirectory(env_));
  vars_["Q7_CONFIG_DIR"] = "/etc/q7";
  EXPECT_EQ("/etc/q7/", ConfigDirectory(env_));
}

// Each source of the address hides the ones after it: environment, q7.env, .addr, default.
TEST_F(ConfigTest, AddressPrecedence) {
  EXPECT_EQ("127.0.0.1:7420", Address());
  scratch_.write("logs/q7agent.addr", "127.0.0.1:40001\n");
  EXPECT_EQ("127.0.0.1:40001", Address());
  scratch_.write("config/q7.env",
                 "# comment\nQ7_HTTP_ADDRESS=10.0.0.1:1\n Q7_HTTP_ADDRESS = \"10.0.0.2:2\" \n");
  EXPECT_EQ("10.0.0.2:2", Address());  // the last definition, trimmed and unquoted
  vars_["Q7_HTTP_ADDRESS"] = "192.168.1.1:3";
  EXPECT_EQ("192.168.1.1:3", Address());
}

// An agent told to pick its port is found through the address it wrote.
TEST_F(ConfigTest, PortZeroPrefersTheAddressFile) {
  vars_["Q7_HTTP_ADDRESS"] = "127.0.0.1:0";
  std::string address, error;
  EXPECT_FALSE(ResolveAddress(env_, &address, &error));
  EXPECT_NE(std::string::npos, error.find("logs/q7agent.addr")) << error;

  scratch_.write("logs/q7agent.addr", "127.0.0.1:45678\n");
  EXPECT_EQ("127.0.0.1:45678", Address());
  vars_.erase("Q7_HTTP_ADDRESS");
  scratch_.write("config/q7.env", "Q7_HTTP_ADDRESS=0.0.0.0:0\n");
  EXPECT_EQ("127.0.0.1:45678", Address());
}

// The token file is trimmed; a missing or blank one means no token; --token wins.
TEST_F(ConfigTest, TokenFromTheConfigDirectory) {
  EXPECT_EQ("", ResolveToken(env_));
  scratch_.write("config/q7_api_token", "  \n");
  EXPECT_EQ("", ResolveToken(env_));
  scratch_.write("config/q7_api_token", "s3cr3t\n");
  EXPECT_EQ("s3cr3t", ResolveToken(env_));

  Connection connection;
  std::string error;
  ASSERT_TRUE(ResolveConnection(env_, "", "", "", &connection, &error));
  EXPECT_EQ("http://127.0.0.1:7420", connection.url);
  EXPECT_EQ("s3cr3t", connection.token);
  EXPECT_EQ("", connection.ca_certificate);
  ASSERT_TRUE(ResolveConnection(env_, "http://h:1/", "other", "", &connection, &error));
  EXPECT_EQ("http://h:1", connection.url);
  EXPECT_EQ("other", connection.token);
}

// An agent with a certificate is reached over HTTPS, checked against the configured CA unless
// --cacert names another; an address with its own scheme or --url keeps it.
TEST_F(ConfigTest, AgentWithACertificateIsReachedOverHttps) {
  scratch_.write("config/q7.env",
                 "Q7_HTTP_ADDRESS=10.0.0.5:7443\nQ7_TLS_CERT=/etc/q7/agent.pem\n"
                 "Q7_TLS_CACERT=/etc/q7/ca.pem\n");
  Connection connection;
  std::string error;
  ASSERT_TRUE(ResolveConnection(env_, "", "", "", &connection, &error));
  EXPECT_EQ("https://10.0.0.5:7443", connection.url);
  EXPECT_EQ("/etc/q7/ca.pem", connection.ca_certificate);
  ASSERT_TRUE(ResolveConnection(env_, "", "", "/tmp/other.pem", &connection, &error));
  EXPECT_EQ("/tmp/other.pem", connection.ca_certificate);
  ASSERT_TRUE(ResolveConnection(env_, "http://h:1", "", "", &connection, &error));
  EXPECT_EQ("http://h:1", connection.url);
  vars_["Q7_TLS_CERT"] = "";  // empty in the environment: the file's setting still holds
  ASSERT_TRUE(ResolveConnection(env_, "", "", "", &connection, &error));
  EXPECT_EQ("https://10.0.0.5:7443", connection.url);
}

// An address becomes a URL; an agent listening everywhere is reached on loopback.
TEST(AddressToUrlTest, SchemeAndWildcards) {
  EXPECT_EQ("http://127.0.0.1:7420", AddressToUrl("127.0.0.1:7420"));
  EXPECT_EQ("https://agent:443", AddressToUrl("https://agent:443/"));
  EXPECT_EQ("http://127.0.0.1:9", AddressToUrl("0.0.0.0:9"));
  EXPECT_EQ("http://[::1]:9", AddressToUrl("[::]:9"));
  EXPECT_EQ("http://[fe80::1]:9", AddressToUrl("[fe80::1]:9"));
}

}  // namespace
}  // namespace q7ctl
