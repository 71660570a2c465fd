#pragma once

// The agent's life from the environment switches to the end of shutdown: an Agent built from
// the process's parts, run. Runs on the main thread. Returns the framework main loop's result.
int CtMain(int argc, char** argv);
