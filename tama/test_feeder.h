#pragma once

// A stand-in for the file manager until it exists: when Q7_TEST_FEED_FILE names a collector data
// file, the analyzer's feeder reads that file once, whole, and queues every record it holds as
// the data file monitor will (parse, identity, add). For end-to-end tests only; without the
// variable nothing is installed.

namespace tama {

// Installs the feeder factory when Q7_TEST_FEED_FILE is set. Main thread, before start-up.
void installTestFeeder();

}  // namespace tama
