#include "daemon/WorkingDirectories.h"

#include <string_view>

#include "platform/Files.h"
#include "platform/Log.h"

namespace velk {

namespace {

void probe(const std::string& directory, std::string_view consequence) {
  const auto writable = files::probeWritable(directory);
  if (writable) return;
  log::error("velkreportingd: %@, so %@ (the directory must belong to the user that the daemon runs as, and have room)",
             writable.error(), consequence);
}

void sweep(const std::string& directory) {
  const auto count = files::sweepTemporaries(directory);
  if (count > 0) log::standard("velkreportingd: removed %u half-written files from %@", count, directory);
}

}  // namespace

Result<void> prepareWorkingDirectories(const std::string& state, const std::string& cache,
                                       const std::string& storebags) {
  for (const auto* directory : {&state, &cache}) {
    if (auto made = files::createDirectories(*directory); !made) return made;
  }
  for (const auto* directory : {&state, &cache, &storebags}) sweep(*directory);
  probe(state, "settings and identifiers are not kept");
  probe(cache, "storebags are fetched anew after each start");
  return {};
}

}  // namespace velk
