#pragma once

// RecordSink: where sm3capture's finished records go (a file, the writer's FIFO, a test).

#include "collector/sm3gen/record.h"

namespace capture {

class RecordSink {
 public:
  virtual ~RecordSink() = default;
  // One finished record; the sink formats and writes it, or counts it lost.
  virtual void Write(const sm3gen::Record& record) = 0;
};

}  // namespace capture
