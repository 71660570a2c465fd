#pragma once

// Reading of the agent's configuration at start-up: the framework's home and configuration
// directories, the properties file and the framework configuration file, merged into the agent
// properties (AgentProperties), and the outlier limit taken from them into CConfig.
//
// Thread safety: main thread only, during start-up and before any worker thread starts.

// Builds KTX_MordelDir, KQ1_BaseDir, KQ1_ConfigPath, KQ1_DetailsPath (and KQ1_CLASSPATH and
// RT_BundlePath when KQ7_CLASSPATH is set; the agent messages then open that bundle), loads the
// properties file, sets the fixed properties (AgentBaseDir, AgentConfigDir, AgentType,
// AgentVersion, AgentLibDir), then lets the unnamed instance of the configuration file override
// them entry by entry. Failures leave empty values or the properties gathered so far, with a trace;
// nothing stops the agent.
void readAgentConfig();

// Sets the outlier limit from the property KQ7EXCLUDEOUTLIERSECONDS: whole seconds when it
// starts with a non-zero integer, else fractional seconds as milliseconds; a value converting
// to 0 (or absent) leaves the limit unset.
void doExcludeOutliers();
