// velkcollector: the other end of the reporting daemon, for trying, testing and small fleets.
#include <iostream>
#include <string>
#include <vector>

#include "tools/StopSignals.h"
#include "tools/collector/Program.h"

int main(int argc, char** argv) {
  velk::tools::StopSignals signals;
  std::ios::sync_with_stdio(false);
  return velk::tools::status(
      velk::collector::run(std::vector<std::string>(argv + 1, argv + argc), std::cout, std::cerr, signals));
}
