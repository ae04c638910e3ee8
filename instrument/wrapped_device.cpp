// The services around the device: installer, backup, policy, shell, icons, notifications, and the daemon's transfers.

#include <map>

#include "instrument/wrappers.h"

namespace appsync {

namespace {

class WrappedInstaller : public KilnInstaller {
 public:
  WrappedInstaller(KilnInstaller& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::optional<PropertyList> KilnLookupUninstalled() override {
    return _probe.call("KilnLookupUninstalled", Subject::none(), nullptr, [&](ErrorOut) {
      return scripted(_probe.script()->KilnLookupUninstalled, [&] { return _bare.KilnLookupUninstalled(); });
    });
  }
  int KilnClearUninstalled(const std::vector<std::string>& bundleIDs) override {
    const auto forward = [&](ErrorOut) { return _bare.KilnClearUninstalled(bundleIDs); };
    return _probe.call("KilnClearUninstalled", Subject::applications(bundleIDs), nullptr, forward, bundleIDs);
  }

 private:
  KilnInstaller& _bare;
  Probe& _probe;
};

class WrappedVaultryManager : public VaultryManager {
 public:
  WrappedVaultryManager(std::unique_ptr<VaultryManager> bare, Probe& probe) : _bare(std::move(bare)), _probe(probe) {}

  bool dovelShouldCreateAppPlaceholdersWithError(ErrorOut error) override {
    return _probe.call("dovelShouldCreateAppPlaceholdersWithError", Subject::none(), error, [&](ErrorOut out) {
      const auto script = _probe.script();
      const auto given =
          script->dovelShouldCreateAppPlaceholders ? script->dovelShouldCreateAppPlaceholders() : std::nullopt;
      if (!given) return _bare->dovelShouldCreateAppPlaceholdersWithError(out);
      if (given->second) setError(out, given->second);
      return given->first;
    });
  }

 private:
  const std::unique_ptr<VaultryManager> _bare;
  Probe& _probe;
};

class WrappedVaultryService : public VaultryService {
 public:
  WrappedVaultryService(VaultryService& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::unique_ptr<VaultryManager> makeVaultryManager() override {
    return _probe.call("makeVaultryManager", Subject::none(), nullptr,
                       [&](ErrorOut) -> std::unique_ptr<VaultryManager> {
                         return std::make_unique<WrappedVaultryManager>(_bare.makeVaultryManager(), _probe);
                       });
  }

 private:
  VaultryService& _bare;
  Probe& _probe;
};

class WrappedProfileConnection : public TessaProfileConnection {
 public:
  WrappedProfileConnection(TessaProfileConnection& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  TessaBoolean effectiveBoolValueForSetting(const std::string& feature) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->effectiveBoolValueForSetting, [&] { return _bare.effectiveBoolValueForSetting(feature); },
          feature);
    };
    return _probe.call("effectiveBoolValueForSetting", Subject::none(), nullptr, answer, feature);
  }

 private:
  TessaProfileConnection& _bare;
  Probe& _probe;
};

class WrappedShell : public BrelmShell {
 public:
  WrappedShell(BrelmShell& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  BrelmPort BrelmBlockableServerPort() override {
    BrelmPort port;
    _probe.tell("BrelmBlockableServerPort", Subject::none(), [&] { port = _bare.BrelmBlockableServerPort(); });
    return port;
  }
  int BrelmSetIconState(BrelmPort port, const std::uint8_t* bytes, std::size_t length) override {
    const auto forward = [&](ErrorOut) { return _bare.BrelmSetIconState(port, bytes, length); };
    return _probe.call("BrelmSetIconState", Subject::none(), nullptr, forward, length, "bytes");
  }
  std::optional<Bytes> BrelmGetFlattenedIconState(BrelmPort port, std::uint32_t format) override {
    const auto answer = [&](ErrorOut) {
      return scripted(_probe.script()->BrelmGetFlattenedIconState,
                      [&] { return _bare.BrelmGetFlattenedIconState(port, format); });
    };
    return _probe.call("BrelmGetFlattenedIconState", Subject::none(), nullptr, answer, field("format", format));
  }

 private:
  BrelmShell& _bare;
  Probe& _probe;
};

class WrappedImageDestination : public ImageDestination {
 public:
  WrappedImageDestination(std::unique_ptr<ImageDestination> bare, Probe& probe)
      : _bare(std::move(bare)), _probe(probe) {}

  void addImage(const Image& image) override {
    _probe.tell(
        "addImage", Subject::none(), [&] { _bare->addImage(image); }, image);
  }
  bool finalize() override {
    return _probe.call("finalize", Subject::none(), nullptr, [&](ErrorOut) { return _bare->finalize(); });
  }

 private:
  const std::unique_ptr<ImageDestination> _bare;
  Probe& _probe;
};

class WrappedIconServices : public IconServices {
 public:
  WrappedIconServices(IconServices& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::optional<Bundle> bundleWithURL(const FileURL& url) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->bundleWithURL, [&] { return _bare.bundleWithURL(url); }, url.path());
    };
    return _probe.call("bundleWithURL", Subject::path(url.path()), nullptr, answer, url);
  }
  std::optional<Image> GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(const Bundle& bundle) override {
    const auto answer = [&](ErrorOut) {
      return scripted(
          _probe.script()->iconImage,
          [&] { return _bare.GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle(bundle); }, bundle);
    };
    return _probe.call("GlintCreateDeviceAppropriateHomeScreenIconImageFromBundle", Subject::path(bundle.url.path()),
                       nullptr, answer, bundle);
  }
  std::unique_ptr<ImageDestination> makePNGDestination(Bytes& buffer) override {
    const auto forward = [&](ErrorOut) -> std::unique_ptr<ImageDestination> {
      std::unique_ptr<ImageDestination> bare = _bare.makePNGDestination(buffer);
      if (bare == nullptr) return nullptr;
      return std::make_unique<WrappedImageDestination>(std::move(bare), _probe);
    };
    return _probe.call("makePNGDestination", Subject::none(), nullptr, forward);
  }

 private:
  IconServices& _bare;
  Probe& _probe;
};

class WrappedNotificationService : public NotificationService {
 public:
  WrappedNotificationService(NotificationService& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  std::uint32_t registerCheck(const std::string& name, int& token) override {
    const auto forward = [&](ErrorOut) { return _bare.registerCheck(name, token); };
    return _probe.call("registerCheck", Subject::none(), nullptr, forward, name);
  }
  void setState(int token, std::uint64_t state) override {
    _probe.tell(
        "setState", Subject::none(), [&] { _bare.setState(token, state); }, state);
  }
  void post(const std::string& name) override {
    _probe.tell(
        "post", Subject::none(), [&] { _bare.post(name); }, name);
  }

 private:
  NotificationService& _bare;
  Probe& _probe;
};

class WrappedNotificationCenter : public NotificationCenter {
 public:
  WrappedNotificationCenter(NotificationCenter& bare, Probe& probe) : _bare(bare), _probe(probe) {}

  void addObserver(const std::shared_ptr<void>& observer, Callback callback, const std::string& name,
                   NotificationSuspension suspension) override {
    const auto between = std::make_shared<Between>(Between{*this, observer, callback});
    {
      MutexLock lock(_mutex);
      _between.emplace(std::pair(static_cast<const void*>(observer.get()), name), between);
    }
    const auto forward = [&] { _bare.addObserver(between, &WrappedNotificationCenter::arrived, name, suspension); };
    _probe.tell("addNotificationObserver", Subject::none(), forward, name);
  }
  void removeObserver(const std::shared_ptr<void>& observer, const std::string& name) override {
    const auto forward = [&] {
      for (const std::shared_ptr<Between>& between : take(observer.get(), name)) {
        _bare.removeObserver(between, name);
        _probe.forget(between.get());
      }
    };
    _probe.tell("removeNotificationObserver", Subject::none(), forward, name);
  }

 private:
  // Stands between the center and one observer.
  struct Between {
    WrappedNotificationCenter& center;
    std::shared_ptr<void> observer;
    Callback callback;
  };

  static void arrived(NotificationCenter* /*bare*/, void* between, const std::string& name, const void* object,
                      const void* userInfo) {
    auto& [center, observer, callback] = *static_cast<Between*>(between);
    const auto action = [&center = center, observer = observer, callback = callback, name, object, userInfo] {
      callback(&center, observer.get(), name, object, userInfo);
    };
    center._probe.deliver(InstrumentedService::NotificationCenter, "notification", "", between, name, action);
  }
  std::vector<std::shared_ptr<Between>> take(const void* observer, const std::string& name) {
    MutexLock lock(_mutex);
    std::vector<std::shared_ptr<Between>> taken;
    const auto [first, last] = _between.equal_range({observer, name});
    for (auto each = first; each != last; ++each) taken.push_back(each->second);
    _between.erase(first, last);
    return taken;
  }

  NotificationCenter& _bare;
  Probe& _probe;
  Mutex _mutex;
  std::multimap<std::pair<const void*, std::string>, std::shared_ptr<Between>> _between APPSYNC_GUARDED_BY(_mutex);
};

class WrappedDeviceService : public DovelDeviceService {
 public:
  WrappedDeviceService(DovelDeviceService& bare, Probe& probe, LackingOperations& lacking)
      : _bare(bare), _probe(probe), _lacking(lacking) {}

  bool offers(Operation operation) override {
    const auto answer = [&](ErrorOut) { return !_lacking.of(operation) && _bare.offers(operation); };
    return _probe.call(
        "offers", Subject::none(), nullptr, answer,
        operation == Operation::PrioritizeAsset ? "prioritizeAsset" : "cancelAssetTransferForFailedAsset");
  }
  void prioritizeAsset(const DovelAssetRef& asset, Completion completion) override {
    const auto forward = [&](const Completion& recorded) { _bare.prioritizeAsset(asset, recorded); };
    _probe.start("prioritizeAsset", asset->identifier(), completion, forward, asset->identifier());
  }
  void cancelAssetTransferForFailedAsset(const DovelAssetRef& asset) override {
    const auto forward = [&] { _bare.cancelAssetTransferForFailedAsset(asset); };
    _probe.tell("cancelAssetTransferForFailedAsset", Subject::application(asset->identifier()), forward,
                asset->identifier());
  }

 private:
  DovelDeviceService& _bare;
  Probe& _probe;
  LackingOperations& _lacking;
};

}  // namespace

std::unique_ptr<KilnInstaller> wrap(KilnInstaller& bare, Probe& probe) {
  return std::make_unique<WrappedInstaller>(bare, probe);
}

std::unique_ptr<VaultryService> wrap(VaultryService& bare, Probe& probe) {
  return std::make_unique<WrappedVaultryService>(bare, probe);
}

std::unique_ptr<TessaProfileConnection> wrap(TessaProfileConnection& bare, Probe& probe) {
  return std::make_unique<WrappedProfileConnection>(bare, probe);
}

std::unique_ptr<BrelmShell> wrap(BrelmShell& bare, Probe& probe) {
  return std::make_unique<WrappedShell>(bare, probe);
}

std::unique_ptr<IconServices> wrap(IconServices& bare, Probe& probe) {
  return std::make_unique<WrappedIconServices>(bare, probe);
}

std::unique_ptr<NotificationService> wrap(NotificationService& bare, Probe& probe) {
  return std::make_unique<WrappedNotificationService>(bare, probe);
}

std::unique_ptr<NotificationCenter> wrap(NotificationCenter& bare, Probe& probe) {
  return std::make_unique<WrappedNotificationCenter>(bare, probe);
}

std::unique_ptr<DovelDeviceService> wrap(DovelDeviceService& bare, Probe& probe, LackingOperations& lacking) {
  return std::make_unique<WrappedDeviceService>(bare, probe, lacking);
}

}  // namespace appsync
