#pragma once

// Process plumbing shared by the two collector programs: signal state at start-up, the pid
// file sm3ctl watches, and the FIFO between them.
//
// Thread safety: the functions are meant for a single-threaded main; StopRequested may be read
// from anywhere.

#include <string>

namespace collector {

// Undoes what the agent and a non-interactive shell hand us: SIGINT and SIGTERM blocked (the
// agent's mask survives fork and exec) and SIGINT ignored (background jobs of sh). Both get
// their default action back and are unblocked. Call first thing in main.
void RestoreStopSignals();

// Installs a handler for SIGINT and SIGTERM that only records the request, without
// SA_RESTART, so blocking calls return EINTR and the main loop sees it, and unblocks both.
// SIGPIPE is ignored: a vanished reader shows as EPIPE.
void InstallStopHandlers();

// True once SIGINT or SIGTERM arrived.
bool StopRequested();

// The pid file names this process while it lives: written at construction (through a
// temporary name, so a reader never sees half a number) and removed at destruction unless it
// names another process by then (a newer instance took it over).
class PidFile {
 public:
  PidFile() = default;
  ~PidFile();
  PidFile(const PidFile&) = delete;
  PidFile& operator=(const PidFile&) = delete;

  // Writes getpid() to path; an empty path does nothing. False with *error on failure.
  bool Write(const std::string& path, std::string* error);

 private:
  std::string path_;
};

// Makes sure path is a FIFO, creating it (mode 0600) when nothing is there. False with *error
// when it cannot be created or something else has the name.
bool EnsureFifo(const std::string& path, std::string* error);

// strerror(errno) prefixed by what failed: "what: reason".
std::string ErrnoText(const std::string& what);

}  // namespace collector
