#pragma once

#include <string_view>

#include "platform/Extensions.h"
#include "platform/Protocol.h"

namespace storix {

// The names of the class and its functions begin with an underscore on every platform.
// NOLINTBEGIN(bugprone-reserved-identifier)

/// What the daemon exports to an extension: nothing, no operations.
const ProtocolDescription &_KTStorixHostProtocol();

/// The host side of a request to a provider extension. It names the two protocols of a request's
/// connection to the platform, which finds the class by its name when it makes a request's context;
/// nothing else refers to it. `main` registers it before the first request.
class _KTStorixExtensionHostContext : public ExtensionContext {
 public:
  static constexpr std::string_view name = "_KTStorixExtensionHostContext";

  using ExtensionContext::ExtensionContext;

  /// Both give the identical object on every call, on any thread.
  static const LinkInterface &_extensionAuxiliaryHostProtocol();
  static const LinkInterface &_extensionAuxiliaryVendorProtocol();

  /// What `PlatformServices::registerExtensionContextClass` takes under `name`.
  static ExtensionContextClass contextClass();
};

// NOLINTEND(bugprone-reserved-identifier)

}  // namespace storix
