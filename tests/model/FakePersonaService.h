// A persona service whose persona list and current persona tests set.
#pragma once

#include <mutex>

#include "platform/VSAPersonaService.h"

class FakePersonaService : public VSAPersonaService {
 public:
  std::optional<std::vector<VSAPersonaAttributes>> listPersonas() override {
    std::lock_guard lock(mutex_);
    ++listCalls;
    return personas;
  }
  std::optional<VSAPersonaAttributes> currentPersona() override {
    std::lock_guard lock(mutex_);
    return current;
  }
  void registerObserver(const std::string&, std::function<void()> onChange,
                        std::function<void(VSAErrorRef)> completion) override {
    changed = std::move(onChange);
    completion(nullptr);
  }

  static VSAPersonaAttributes persona(VSAPersonaAttributes::Kind kind, uint32_t id,
                                      std::optional<std::string> unique,
                                      std::vector<std::string> apps = {},
                                      std::optional<std::string> layout = std::nullopt) {
    VSAPersonaAttributes a;
    a.kind = kind;
    a.personaID = id;
    a.uniqueString = std::move(unique);
    a.bundleIdentifiers = std::move(apps);
    a.layoutPath = std::move(layout);
    return a;
  }

  std::mutex mutex_;
  std::optional<std::vector<VSAPersonaAttributes>> personas;
  std::optional<VSAPersonaAttributes> current;
  std::function<void()> changed;
  int listCalls = 0;
};
