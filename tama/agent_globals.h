#pragma once

// Process-wide identity and path globals of the agent. Written once on the main thread during
// start-up (before any worker thread starts), read-only afterwards, so readers take no lock.

#include <cstddef>

inline constexpr std::size_t kPathBufferSize = 4096;

// Product code under which the agent registers: "Q7" and a zero byte.
extern char kq1_product_code[3];
// Product version set by the framework from the product code ("01.00.00").
extern char kq1_product_ver[10];
// Agent name: "$UNKNOWN$", or the first 24 characters of the uname node name.
extern char kq1_agent_name[256];
// The agent name cut at its first '.'.
extern char kq1_short_agent_name[256];
// Local host name from the framework's lookup (blank-filled first).
extern char kq1_system_name[64];
// Agent message log file name ("./" + name).
extern char KQ1_MsgFileName[kPathBufferSize];

// Paths built by the configuration reader.
extern char KQ1_BaseDir[kPathBufferSize];      // agent base directory (<home>zorvan6)
extern char KTX_MordelDir[kPathBufferSize];    // framework home directory
extern char KQ1_ConfigPath[kPathBufferSize];   // framework configuration file
extern char KQ1_DetailsPath[kPathBufferSize];  // properties file
extern char KQ1_CLASSPATH[kPathBufferSize];    // agent library directory
extern char RT_BundlePath[kPathBufferSize];    // message bundle path

// The product's display name, reported as the "AgentType" property.
inline constexpr const char* kProductDisplayName = "q7agent Response Time Agent";
