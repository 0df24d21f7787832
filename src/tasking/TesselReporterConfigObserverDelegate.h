// TesselReporterConfigObserverDelegate: hands configuration changes to a closure.
//
// The delegate owns the closure and the closure what it captured, so both live for as long as the
// analytics service keeps the delegate, also after the gate that made it has returned.

#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>

#include "platform/Analytics.h"

namespace tessel {

class TesselReporterConfigObserverDelegate final : public ConfigurationObserverDelegate {
 public:
  // Takes the configuration, null where it is absent, and its type.
  using CallbackBlock =
      std::function<void(const std::shared_ptr<const ConfigurationValue>&, const std::string&)>;

  explicit TesselReporterConfigObserverDelegate(CallbackBlock callbackBlock)
      : callbackBlock_(std::move(callbackBlock)) {}

  const CallbackBlock& callbackBlock() const { return callbackBlock_; }
  void setCallbackBlock(CallbackBlock callbackBlock) { callbackBlock_ = std::move(callbackBlock); }

  void observerDidChangeConfiguration(
      ConfigurationObserver& /*observer*/,
      const std::shared_ptr<const ConfigurationValue>& configuration,
      const std::string& type) override {
    callbackBlock_(configuration, type);
  }

 private:
  CallbackBlock callbackBlock_;
};

}  // namespace tessel
