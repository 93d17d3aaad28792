// A client of a process that has ended.
#pragma once

#include <sys/types.h>

#include <memory>
#include <string>
#include <utility>

#include "platform/ClientConnection.h"

namespace vx::lnx {

// What the service sees of a recorded connection: its calls come from the journal, nobody hears
// their answers, and it ends once. Owned by the recovery; belongs to the interactive thread.
class RecoveredConnection final : public ClientConnection {
 public:
  RecoveredConnection(pid_t pid, uid_t uid) : pid_(pid), uid_(uid) {}

  int32_t processIdentifier() const override { return pid_; }
  uid_t user() const { return uid_; }
  std::string description() const override {
    return "<RecoveredConnection pid " + std::to_string(pid_) + " uid " + std::to_string(uid_) +
           ">";
  }
  void setExportedInterface(const InterfaceDescription& interface) override {
    interface_ = &interface;
  }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override {
    object_ = std::move(object);
  }
  std::shared_ptr<ExportedObject> exportedObject() const override { return object_; }
  void setInterruptionHandler(Function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void setInvalidationHandler(Function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void resume() override {}

  const InterfaceDescription* interface() const { return interface_; }
  void interrupt() {
    if (interruption_) interruption_();
  }
  void invalidate() {
    if (invalidation_) invalidation_();
  }

 private:
  const pid_t pid_;
  const uid_t uid_;
  const InterfaceDescription* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  Function<void()> interruption_;
  Function<void()> invalidation_;
};

}  // namespace vx::lnx
