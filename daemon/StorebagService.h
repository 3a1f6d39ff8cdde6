// Fetches storebags: from the disk cache, from the server when there is no copy, and from the server in the background
// when the copy has aged; verifies each, and picks the section of the current environment.
//
// One a process; the agent's memory cache is its caller. Everything that touches the disk cache, the metrics, the
// verification with saving and the making of the transport runs under the storebag lock, which is never held while
// the network is waited for. Where the agent's lock is held as well, it was taken first.
#pragma once

#include <cstdint>
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
};

/// Any thread. Made with `make`: answers of the network that come late find out whether it still lives.
class StorebagService : public std::enable_shared_from_this<StorebagService> {
 public:
  /// `platform` and `environment` outlive it and every transport that it made.
  [[nodiscard]] static std::shared_ptr<StorebagService> make(const Platform& platform,
                                                             const DeviceEnvironment& environment,
                                                             std::unique_ptr<StorebagDiskCache> diskCache,
                                                             StorebagPublicKeySource publicKey);

  /// Blocks for up to the request's 15 seconds when there is no copy on disk, otherwise for file work only.
  [[nodiscard]] StorebagSection fetchStorebagForEnvironmentAndClientType(std::int32_t clientType);

  /// When the copy on disk was written; nothing without one.
  [[nodiscard]] std::optional<TimeValue> diskModificationDate(const std::string& name) const;

  /// Lets the transport go, with its memory of what was asked before. The next network fetch makes a new one.
  /// Requests on their way end as they would have; delayed ones fail.
  void startAfresh();

  /// The process ends: a fetch that waits for the network fails at once, and later ones do not ask it. Never blocks for
  /// more than file work. Once; nothing takes it back.
  void stop();

 private:
  struct Fetched {
    std::optional<PropertyDictionary> storebag;
    std::int32_t maxAge = 0;
    bool handled = false;
  };
  struct PendingFetch;
  enum class Save { no, yes };

  StorebagService(const Platform& platform, const DeviceEnvironment& environment,
                  std::unique_ptr<StorebagDiskCache> diskCache, StorebagPublicKeySource publicKey);

  [[nodiscard]] Fetched fetchStorebagWithName(const std::string& name);
  [[nodiscard]] std::optional<PropertyDictionary> storebagFromDisk(const std::string& name);
  [[nodiscard]] std::optional<PropertyDictionary> usableDiskCopyLocked(const std::string& name)
      VELK_REQUIRES(_storebagLock);
  [[nodiscard]] bool hasExpiredLocked(const std::string& name, std::int32_t maxAge) const VELK_REQUIRES(_storebagLock);
  [[nodiscard]] std::optional<PropertyDictionary> verifyAndUnpackLocked(const std::string& name,
                                                                        std::span<const std::uint8_t> envelope,
                                                                        Save save) VELK_REQUIRES(_storebagLock);

  [[nodiscard]] std::string storebagUrl(const std::string& name) const;
  [[nodiscard]] HttpRequest makeRequest(const std::string& name, const std::optional<std::string>& lastModified) const;
  /// Null once the service has been stopped.
  [[nodiscard]] std::shared_ptr<ReportingSessionConnectivityHelper> connectivityHelper();
  void refreshInBackground(const std::string& name, const std::optional<std::string>& lastModified);
  /// False, and no answer, when the service has been stopped.
  [[nodiscard]] bool startWaiting(const std::shared_ptr<PendingFetch>& pending);
  [[nodiscard]] bool isStopped() const;
  void endWaiting(const std::shared_ptr<PendingFetch>& pending);
  [[nodiscard]] std::optional<ByteData> fetchSynchronously(const std::string& name);
  void networkAnswered(const std::string& name, const ByteData& data, const HttpResponse* response,
                       const std::optional<Error>& error);

  // Constant after construction.
  const Platform _platform;
  const DeviceEnvironment& _environment;
  const StorebagPublicKeySource _publicKey;

  // The storebag lock, and what it guards. It is held during file work.
  mutable Monitor _storebagLock;
  const std::unique_ptr<StorebagDiskCache> _diskCache;
  StorebagMetrics _metrics VELK_GUARDED_BY(_storebagLock);
  std::shared_ptr<ReportingSessionConnectivityHelper> _connectivityHelper VELK_GUARDED_BY(_storebagLock);

  // Guarded by a lock of its own, so that stopping waits for no file work.
  mutable Lock _waitingLock;
  std::vector<std::shared_ptr<PendingFetch>> _waiting VELK_GUARDED_BY(_waitingLock);
  bool _stopped VELK_GUARDED_BY(_waitingLock) = false;
};

}  // namespace velk
