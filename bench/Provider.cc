// A provider made with the SDK that has nothing to do: what an author's own work comes on top of.

#include "storix/ProviderExtension.h"

namespace {

class IdleProvider : public storix::ProviderExtension {
 public:
  using ProviderExtension::ProviderExtension;
  void startProviding(const storix::URL & /*url*/, Completion completion) override { completion(std::nullopt); }
};

}  // namespace

int main() { return storix::runProviderExtension<IdleProvider>(); }
