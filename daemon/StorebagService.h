// Fetches storebags: from the disk cache, from the server when there is no copy, and from the server in the background
// when the copy has aged; verifies each, and picks the section of the current environment.
//
// One a process; the agent's memory cache is its caller. Everything that touches the disk cache, the metrics, the
// verification with saving and the table of pulls runs under the storebag lock, which is never held while the network
// is waited for. Where the agent's lock is held as well, it was taken first.
//
// A transport pulls an address once in its life, so each pull gets a transport of its own. While a delayed pull waits,
// the time at which it is due stands in the user-defaults suite: a daemon that ends first leaves it to the next one.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "connectivity/ConnectivityInterface.h"
#include "daemon/StorebagDiskCache.h"
#include "daemon/StorebagEnvelope.h"
#include "daemon/StorebagMetrics.h"
#include "device/DeviceEnvironment.h"
#include "foundation/PropertyValue.h"
#include "platform/Lock.h"
#include "platform/Platform.h"

namespace velk {

class ReportingSessionConnectivityHelper;

/// What a fetch brought.
struct StorebagSection {
  /// The section of the environment, with "release_timeout" added; nothing when the fetch failed.
  std::optional<PropertyDictionary> section;
  std::optional<std::string> version;
  /// In seconds; 0 when nothing was ever stored.
  std::int32_t maxAge = 0;
  /// The storebag at hand has been dealt with before, and its absence is no failure.
  bool handled = false;
  /// The modification date of the copy on disk that this fetch has seen; nothing when there was none.
  std::optional<TimeValue> copyDate;
};

/// Longer than the request's own 15 seconds, and all that the agent's lock is held for.
inline constexpr Duration kStorebagAnswerLimit = std::chrono::seconds(20);

/// Any thread. Made with `make`: answers of the network that come late find out whether it still lives.
class StorebagService : public std::enable_shared_from_this<StorebagService> {
 public:
  /// `platform` and `environment` outlive it and every transport that it made. A fetch that has no answer within
  /// `answerLimit` counts as failed; an answer that comes later is kept on disk all the same.
  [[nodiscard]] static std::shared_ptr<StorebagService> make(const Platform& platform,
                                                             const DeviceEnvironment& environment,
                                                             std::unique_ptr<StorebagDiskCache> diskCache,
                                                             StorebagPublicKeySource publicKey,
                                                             Duration answerLimit = kStorebagAnswerLimit);

  /// Blocks for up to the answer limit when there is no copy on disk, otherwise for file work only.
  [[nodiscard]] StorebagSection fetchStorebagForEnvironmentAndClientType(std::int32_t clientType);

  /// When the copy on disk was written; nothing without one.
  [[nodiscard]] std::optional<TimeValue> diskModificationDate(const std::string& name) const;

  /// Lets all transports go. Requests on their way end as they would have. Delayed ones are not made, but stay due: the
  /// next fetch that finds its copy expired takes them over.
  void startAfresh();

  /// The process ends: a fetch that waits for the network fails at once, and later ones do not ask it. Never blocks for
  /// more than file work. Once; nothing takes it back.
  void stop();

 private:
  struct Fetched {
    std::optional<PropertyDictionary> storebag;
    std::int32_t maxAge = 0;
    bool handled = false;
    std::optional<TimeValue> copyDate;
  };
  struct DiskCopy {
    /// Nothing unless there is a copy that can be used.
    std::optional<PropertyDictionary> storebag;
    /// Set whenever there is a file.
    std::optional<TimeValue> date;
    /// There is a copy, but no key to verify it with. Another one from the server could not be verified either.
    bool lacksKey = false;
  };
  /// A request that is due or on its way.
  struct Pull {
    std::uint64_t number;
    bool isUrgent;
    std::shared_ptr<ReportingSessionConnectivityHelper> transport;
  };
  using Pulls = std::map<std::string, Pull>;
  struct PendingFetch;
  enum class Save { no, yes };

  StorebagService(const Platform& platform, const DeviceEnvironment& environment,
                  std::unique_ptr<StorebagDiskCache> diskCache, StorebagPublicKeySource publicKey,
                  Duration answerLimit);

  [[nodiscard]] Fetched fetchStorebagWithName(const std::string& name);
  [[nodiscard]] DiskCopy copyFromDisk(const std::string& name);
  [[nodiscard]] DiskCopy diskCopyLocked(const std::string& name) VELK_REQUIRES(_storebagLock);
  [[nodiscard]] bool hasExpired(const DiskCopy& copy, std::int32_t maxAge) const;
  [[nodiscard]] std::optional<PropertyDictionary> verifyAndUnpackLocked(const std::string& name,
                                                                        std::span<const std::uint8_t> envelope,
                                                                        Save save) VELK_REQUIRES(_storebagLock);

  [[nodiscard]] std::string storebagUrl(const std::string& name) const;
  [[nodiscard]] HttpRequest makeRequest(const std::string& name, const std::optional<std::string>& lastModified) const;
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> makeTransport() const;
  /// Drops `answer` uncalled when the service has been stopped, or while the address is being pulled already. Only an
  /// urgent pull is made beside one that is not: the latter may be hours away.
  void pull(const std::string& name, HttpRequest request, bool isUrgent, HttpCompletion answer);
  void pullEnded(const std::string& name, const std::string& url, std::uint64_t number, const ByteData& data,
                 const HttpResponse* response, const std::optional<Error>& error);
  void pullDropped(const std::string& url, std::uint64_t number);
  /// False when it was let go before, or another pull of the address has taken its place.
  bool forgetPullLocked(const std::string& url, std::uint64_t number) VELK_REQUIRES(_storebagLock);
  /// False, and no answer, when the service has been stopped.
  [[nodiscard]] bool startWaiting(const std::shared_ptr<PendingFetch>& pending);
  [[nodiscard]] bool isStopped() const;
  void endWaiting(const std::shared_ptr<PendingFetch>& pending);
  [[nodiscard]] std::optional<ByteData> fetchSynchronously(const std::string& name);
  void networkAnsweredLocked(const std::string& name, const ByteData& data, const HttpResponse* response,
                             const std::optional<Error>& error) VELK_REQUIRES(_storebagLock);

  // Constant after construction.
  const Platform _platform;
  const DeviceEnvironment& _environment;
  const StorebagPublicKeySource _publicKey;
  const Duration _answerLimit;

  // The storebag lock, and what it guards. It is held during file work.
  mutable Monitor _storebagLock;
  const std::unique_ptr<StorebagDiskCache> _diskCache;
  StorebagMetrics _metrics VELK_GUARDED_BY(_storebagLock);
  /// By address.
  Pulls _pulls VELK_GUARDED_BY(_storebagLock);
  std::uint64_t _lastPull VELK_GUARDED_BY(_storebagLock) = 0;

  // Guarded by a lock of its own, so that stopping waits for no file work.
  mutable Lock _waitingLock;
  std::vector<std::shared_ptr<PendingFetch>> _waiting VELK_GUARDED_BY(_waitingLock);
  bool _stopped VELK_GUARDED_BY(_waitingLock) = false;
};

}  // namespace velk
