#include "platform/AdaptorBundle.h"

#include <dlfcn.h>

#include <exception>
#include <utility>

#include "platform/Files.h"
#include "platform/Lock.h"
#include "platform/TrustedPath.h"
#include "platform/VelkReportingQuillAdaptor.h"
#include "platform/linux/ElfFile.h"
#include "platform/linux/ForeignCalls.h"
#include "platform/linux/KeyValueFile.h"

namespace velk {
namespace {

constexpr const char* kEntryPoint = "VelkReportingCreateQuillAdaptor";
constexpr std::size_t kMaximumConfigurationBytes = 64 * 1024;
/// Of what an exception says.
constexpr std::size_t kMaximumReasonBytes = 200;

using CreateFunction = decltype(&VelkReportingCreateQuillAdaptor);

Failure adaptorFailure(std::string text) { return failure("AdaptorBundle", 1, std::move(text)); }

/// Runs `call`, which answers an adaptor's status.
template <class Call>
Result<void> callAdaptor(ForeignCalls& calls, const std::string& name, const Call& call) {
  const ForeignCalls::Scope counted(calls);
  if (!counted.isEntered()) {
    return adaptorFailure(name + " is not called: too many calls have not returned, or the process ends");
  }
  try {
    const std::int32_t status = call();
    if (status == 0) return {};
    return adaptorFailure(name + " failed with status " + std::to_string(status));
  } catch (const std::exception& exception) {
    return adaptorFailure(name + " threw: " + std::string(exception.what()).substr(0, kMaximumReasonBytes));
  } catch (...) {
    return adaptorFailure(name + " threw an exception");
  }
}

class LoadedAdaptor final : public QuillAdaptor {
 public:
  LoadedAdaptor(std::shared_ptr<ForeignCalls> calls, std::string description, const VelkReportingQuillAdaptor& adaptor)
      : _calls(std::move(calls)), _description(std::move(description)), _adaptor(adaptor) {}

  const std::string& description() const override { return _description; }
  bool respondsToSendMessage() const override { return _adaptor.sendMessageWithMethod != nullptr; }

  Result<void> sendMessageWithMethod(std::uint16_t method, std::uint16_t respCode,
                                     const std::optional<std::string>& dict) override {
    if (!respondsToSendMessage()) return adaptorFailure(_description + " takes no events");
    return callAdaptor(*_calls, _description, [&] {
      return _adaptor.sendMessageWithMethod(_adaptor.context, method, respCode, dict ? dict->c_str() : nullptr,
                                            dict ? dict->size() : 0);
    });
  }

  void release() override {
    if (_adaptor.release == nullptr) return;
    // Whatever becomes of it, there is nobody left to tell.
    static_cast<void>(callAdaptor(*_calls, _description, [this] {
      _adaptor.release(_adaptor.context);
      return 0;
    }));
  }

 private:
  const std::shared_ptr<ForeignCalls> _calls;
  const std::string _description;
  const VelkReportingQuillAdaptor _adaptor;
};

class LoadedAdaptorClass final : public QuillAdaptorClass {
 public:
  LoadedAdaptorClass(std::shared_ptr<ForeignCalls> calls, const std::string& path, CreateFunction create)
      : _calls(std::move(calls)), _description("<QuillAdaptor " + path + ">"), _create(create) {}

  Result<std::unique_ptr<QuillAdaptor>> makeInstance() override {
    VelkReportingQuillAdaptor adaptor{};
    const auto created =
        callAdaptor(*_calls, _description, [&] { return _create(VELK_REPORTING_QUILL_ADAPTOR_VERSION, &adaptor); });
    if (!created) return Failure(created.error());
    return std::make_unique<LoadedAdaptor>(_calls, _description, adaptor);
  }

 private:
  const std::shared_ptr<ForeignCalls> _calls;
  const std::string _description;
  const CreateFunction _create;
};

std::string loaderError() {
  const char* const text = ::dlerror();
  return text != nullptr ? text : "the loader does not say why";
}

class SharedObjectBundle final : public AdaptorBundle {
 public:
  explicit SharedObjectBundle(const std::string& configurationDirectory)
      : _configuration(configurationDirectory + "/" + kAdaptorConfigurationFile) {}

  Result<std::shared_ptr<QuillAdaptorClass>> load() override {
    {
      Guard guard(_lock);
      if (_class) return _class;
    }
    // Several threads may get here at once: the loader maps the file once for all of them.
    const auto named = namedPath();
    if (!named) return Failure(named.error());
    if (named->empty()) return nullptr;
    auto loaded = loadFile(*named);
    if (!loaded) return adaptorFailure(_configuration + ": " + kQuillAdaptorKey + ": " + loaded.error().description);
    Guard guard(_lock);
    if (!_class) _class = std::move(*loaded);
    return _class;
  }

  bool stop(Duration limit) override { return _calls->stop(limit); }

 private:
  /// What the administrator's file names; empty when there is nothing.
  [[nodiscard]] Result<std::string> namedPath() const {
    if (!files::exists(_configuration)) return std::string();
    if (!files::isTrustworthy(_configuration)) {
      return adaptorFailure(_configuration + ": others can write it; no adaptor is loaded");
    }
    const auto bytes = files::read(_configuration, kMaximumConfigurationBytes);
    if (!bytes) return Failure(bytes.error());
    const auto values = parseKeyValues({reinterpret_cast<const char*>(bytes->data()), bytes->size()});
    const auto found = values.find(kQuillAdaptorKey);
    return found == values.end() ? std::string() : found->second;
  }

  [[nodiscard]] Result<std::shared_ptr<QuillAdaptorClass>> loadFile(const std::string& path) {
    const auto trusted = trustedPath(path);
    if (!trusted) return Failure(trusted.error());
    if (const auto checked = checkElfFile(*trusted); !checked) return Failure(checked.error());
    // Constructors run: foreign code as well.
    const ForeignCalls::Scope counted(*_calls);
    if (!counted.isEntered()) return adaptorFailure("too many calls have not returned");
    void* const handle = ::dlopen(trusted->c_str(), RTLD_NOW | RTLD_LOCAL);
    if (handle == nullptr) return adaptorFailure("cannot be loaded: " + loaderError());
    void* const symbol = ::dlsym(handle, kEntryPoint);
    if (symbol == nullptr) {
      const auto missing = adaptorFailure(*trusted + " has no function " + kEntryPoint);
      ::dlclose(handle);
      return missing;
    }
    // The handle is never closed: threads and exit handlers of the adaptor may run to the end of the process.
    return std::make_shared<LoadedAdaptorClass>(_calls, *trusted, reinterpret_cast<CreateFunction>(symbol));
  }

  const std::string _configuration;
  /// Shared with instances, which may be left when the bundle goes.
  const std::shared_ptr<ForeignCalls> _calls = std::make_shared<ForeignCalls>(kMaximumAdaptorCalls);
  Lock _lock;
  std::shared_ptr<QuillAdaptorClass> _class VELK_GUARDED_BY(_lock);
};

}  // namespace

std::unique_ptr<AdaptorBundle> makeAdaptorBundle(const std::string& configurationDirectory) {
  return std::make_unique<SharedObjectBundle>(configurationDirectory);
}

}  // namespace velk
