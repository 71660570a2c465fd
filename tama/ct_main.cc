#include "tama/ct_main.h"

#include "tama/agent.h"

int CtMain(int argc, char** argv) {
  tama::Agent agent(tama::ProcessParts());
  return agent.run(argc, argv);
}
