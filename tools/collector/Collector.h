// What the collector answers: storebags, posts, counts. Knows nothing of sockets or TLS: the server hands it requests
// and sends its answers.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Clock.h"
#include "platform/Lock.h"
#include "tools/collector/Announcer.h"
#include "tools/collector/CollectorOptions.h"
#include "tools/collector/PostStore.h"
#include "tools/collector/ReceivedPost.h"
#include "tools/collector/StorebagFiles.h"

namespace velk::collector {

struct Answer {
  int status = 200;
  std::string body;
  std::string contentType = "application/json";
  HeaderList headers;
};

/// Made by the program before the server, and outlives it. Every method may be called on any thread, on many at once.
class Collector {
 public:
  /// `store` may be null (nothing is kept); it and the others outlive the collector.
  Collector(const CollectorOptions& options, PostStore* store, Announcer& announcer, const Clock& clock);

  /// The signed envelope, or 304 when it has not changed since the moment in `ifModifiedSince` (null: not asked).
  /// Blocks for the delay that the options ask for, or until `stop`.
  [[nodiscard]] Answer storebag(const std::string& name, const std::string* ifModifiedSince);
  /// Takes a post, or refuses it: 400 with a sentence when it is not what it should be, 500 when it cannot be stored.
  [[nodiscard]] Answer post(const std::string& path, const HeaderList& headers, std::string_view wire);
  /// A post whose body never came whole, or is larger than is taken.
  [[nodiscard]] Answer unreadablePost(const std::string& path);
  [[nodiscard]] Answer stats();
  [[nodiscard]] Totals totals();

  /// Ends the delays of `storebag`; never blocks.
  void stop();

 private:
  [[nodiscard]] Answer refuse(const std::string& path, int status, const std::string& reason);
  [[nodiscard]] Result<std::string> checkedBody(const HeaderList& headers, std::string_view wire) const;
  [[nodiscard]] Result<std::int64_t> keep(const ReceivedPost& post, const std::string& path, const HeaderList& headers);
  [[nodiscard]] Answer sinkPost(const std::string& body, std::size_t wireBytes);
  [[nodiscard]] Answer storebagFile(const std::string& name, const std::string* ifModifiedSince) const;
  /// Answers the number of this post among those taken.
  std::uint64_t count(std::size_t events, std::size_t bytes, std::size_t wireBytes);
  void waitForDelay();

  const CollectorOptions& _options;
  const StorebagFiles _storebags;
  const PostBounds _bounds;

  PostStore* const _store;
  Announcer& _announcer;
  const Clock& _clock;

  Lock _lock;
  Condition _stopping;
  bool _stopped VELK_GUARDED_BY(_lock) = false;
  Totals _totals VELK_GUARDED_BY(_lock);
};

}  // namespace velk::collector
