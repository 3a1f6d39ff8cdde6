// velkreportingctl: drives and inspects the reporting daemon from the command line.
#include <iostream>
#include <string>
#include <vector>

#include "tools/ctl/Program.h"

int main(int argc, char** argv) {
  std::ios::sync_with_stdio(false);
  return velk::tools::status(velk::ctl::run(std::vector<std::string>(argv + 1, argv + argc), std::cout, std::cerr));
}
