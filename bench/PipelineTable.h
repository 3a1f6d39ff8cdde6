// The table of a benchmark's runs, for people and for programs.
#pragma once

#include <string>
#include <vector>

#include "bench/PipelineRun.h"

namespace velk::bench {

struct Compared {
  Scenario scenario;
  Measured floor;
  Measured pipeline;
};

[[nodiscard]] std::string table(const std::vector<Compared>& runs);
[[nodiscard]] std::string tableAsJson(const std::vector<Compared>& runs);

}  // namespace velk::bench
