// The diagnostics service's adaptor: foreign code in a shared object that the administrator names. The interface that
// an adaptor implements is VelkReportingQuillAdaptor.h; this is the daemon's side of it, which backends use and tests
// fake.
//
//   AdaptorBundle::load -> QuillAdaptorClass::makeInstance -> sendMessageWithMethod ... -> release
//
// Foreign code may block, so nothing here is called with a lock held, except that nobody can keep a constructor of the
// shared object from blocking the loader. What it throws is caught and becomes an error.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "foundation/Error.h"
#include "foundation/TimeValue.h"

namespace velk {

/// Calls of adaptors that may be under way at once. One that does not return takes a thread and a client with it;
/// this bounds how many. More than the sessions that may be active at once in the client types that use adaptors.
inline constexpr std::size_t kMaximumAdaptorCalls = 16;

/// One instance. Used by one thread at a time.
class QuillAdaptor {
 public:
  virtual ~QuillAdaptor() = default;
  [[nodiscard]] virtual const std::string& description() const = 0;
  /// Whether it takes events at all.
  [[nodiscard]] virtual bool respondsToSendMessage() const = 0;
  /// Hands one event over and waits for the adaptor. `dict` is a line of JSON, if there is any. The error says how the
  /// adaptor failed, or that too many calls are under way.
  [[nodiscard]] virtual Result<void> sendMessageWithMethod(std::uint16_t method, std::uint16_t respCode,
                                                           const std::optional<std::string>& dict) = 0;
  /// Gives the instance back to the adaptor: the last call, at most once. Waits for the adaptor. An object that is
  /// destroyed without it leaves the instance alone.
  virtual void release() = 0;
};

/// What a loaded shared object makes. Any thread.
class QuillAdaptorClass {
 public:
  virtual ~QuillAdaptorClass() = default;
  [[nodiscard]] virtual Result<std::unique_ptr<QuillAdaptor>> makeInstance() = 0;
};

/// The shared object. Any thread; lives as long as the process.
class AdaptorBundle {
 public:
  virtual ~AdaptorBundle() = default;
  /// Loads it unless it is loaded; after a failure the next call tries again, from the administrator's file on. Null
  /// when no adaptor is named there. Once loaded it stays. The error names the file and what to do about it.
  [[nodiscard]] virtual Result<std::shared_ptr<QuillAdaptorClass>> load() = 0;
  /// Lets no further call begin (each fails, `release` does nothing) and waits for those under way. False when some
  /// have not returned within `limit`: their threads can be neither ended nor joined.
  [[nodiscard]] virtual bool stop(Duration limit) = 0;
};

/// The file in the configuration directory, of `KEY=value` lines, and the key of the adaptor's absolute path.
inline constexpr const char* kAdaptorConfigurationFile = "adaptors.conf";
inline constexpr const char* kQuillAdaptorKey = "QuillAdaptor";

[[nodiscard]] std::unique_ptr<AdaptorBundle> makeAdaptorBundle(const std::string& configurationDirectory);

}  // namespace velk
