#include "daemon/SXServer.h"

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

constexpr std::string_view serviceName = "com.tessel.Storix";
constexpr std::string_view firstUnlockNotification = "com.tessel.mobile.vaultkeepd.first_unlock";

}  // namespace

void SXServer::startCompletion(std::function<void()> handler) {
  PlatformServices &platform = ProcessScope::current().platform();
  sx_default_log().info("[INFO] Server starting.");
  setListener(platform.createServiceListener(serviceName));
  setListenerDelegate(std::make_shared<SXLinkListenerDelegate>());
  listenerDelegate_->setServer(shared_from_this());
  listener_->setDelegate(listenerDelegate_);
  // The registry starts its search once, however often this is delivered.
  platform.addSystemNotificationObserver(firstUnlockNotification,
                                         [] { SXExtensionStorix::createInstancesCompletion({}); });

  const bool readable = platform.deviceLockState() == deviceLockStateNoPasscode || platform.deviceUnlockedSinceBoot();
  if (!readable) {
    sx_default_log().info("[INFO] Not instantiating storix providers until first unlock.");
    listener_->resume();
    if (handler) platform.globalQueue()->async(std::move(handler));
    return;
  }
  SXExtensionStorix::createInstancesCompletion([self = shared_from_this(), handler = std::move(handler)] {
    self->listener_->resume();
    if (handler) handler();
  });
}

}  // namespace storix
