// SXExtensionStorix and the file coordination service: coming in, trying again, going.

#include <utility>

#include "platform/Log.h"
#include "platform/PlatformServices.h"
#include "platform/ProcessScope.h"
#include "providers/SXExtensionStorix.h"

namespace storix {

namespace {

constexpr std::uint64_t retryPauseNanoseconds = 2'000'000'000;

constexpr std::string_view registerName = "-[SXExtensionStorix registerWithFileCoordinatorRetryCount:completion:]";

}  // namespace

void SXExtensionStorix::registerWithFileCoordinatorRetryCount(std::int32_t retryCount, ErrorCompletion completion) {
  if (retryCount == 0) {
    if (!completion) return;
    ProcessScope::current().platform().globalQueue()->async(
        [completion = std::move(completion)] { completion(SXPluginOperationFailedError(std::nullopt)); });
    return;
  }
  sx_default_log().debug("[DEBUG] %s", registerName);
  performExtensionRequest([self = shared_from_this(), retryCount, completion = std::move(completion)](
                              std::optional<SXError> error, const std::shared_ptr<_KTStorixVendor> &vendor,
                              const CancelRequest &cancelRequest) {
    if (error) {
      sx_default_log().fault("[ERROR] Error registering storix provider extension %@: %@.", self->identifier(), *error);
      self->retryRegisterWithFileCoordinatorRetryCount(retryCount, std::move(*error), completion);
      return;
    }
    vendor->_performInitialSetupWithCompletion(
        [self, retryCount, completion, cancelRequest](const std::optional<std::string> & /*unused*/,
                                                      const std::optional<URL> & /*unused*/,
                                                      std::optional<SXError> setupError) {
          if (setupError) {
            sx_default_log().fault("[ERROR] Storix provider extension %@ failed to initialize. Error: %@.",
                                   self->identifier(), *setupError);
            self->retryRegisterWithFileCoordinatorRetryCount(retryCount, std::move(*setupError), completion);
          } else {
            self->operationQueue_->addOperation([self, completion] {
              ProcessScope::current().platform().fileCoordinationService().addProvider(self);
              sx_default_log().info("[INFO] Registered storix provider extension %@ for path %@", self->identifier(),
                                    self->providedItemsURL());
              if (completion) completion(std::nullopt);
            });
          }
          cancelRequest();
        });
  });
}

void SXExtensionStorix::retryRegisterWithFileCoordinatorRetryCount(std::int32_t retryCount, SXError lastError,
                                                                   ErrorCompletion completion) {
  if (retryCount < 2) {
    if (completion) completion(std::move(lastError));
    return;
  }
  const std::int32_t triesLeft = retryCount - 1;
  sx_default_log().notice("[NOTICE] Trying to register storix provider extension %@ again. Tries left: %d",
                          identifier(), triesLeft);
  PlatformServices &platform = ProcessScope::current().platform();
  platform.runAfterDelay(retryPauseNanoseconds, platform.globalQueue(),
                         [self = shared_from_this(), triesLeft, completion = std::move(completion)] {
                           self->registerWithFileCoordinatorRetryCount(triesLeft, completion);
                         });
}

void SXExtensionStorix::registerWithFileCoordinatorCompletion(ErrorCompletion completion) {
  registerWithFileCoordinatorRetryCount(1, std::move(completion));
}

void SXExtensionStorix::unregisterFromFileCoordinator() {
  operationQueue_->addOperation([self = shared_from_this()] {
    ProcessScope::current().platform().fileCoordinationService().removeProvider(self);
  });
}

}  // namespace storix
