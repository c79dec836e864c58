#include "providers/_KTStorixExtensionHostContext.h"

#include <memory>
#include <utility>

#include "providers/_KTStorixVendor.h"

namespace storix {

const ProtocolDescription &_KTStorixHostProtocol() {
  static const ProtocolDescription description{
      "_KTStorixHostProtocol", "com.tessel.StorixHost", "/com/tessel/StorixHost", {}};
  return description;
}

const LinkInterface &_KTStorixExtensionHostContext::_extensionAuxiliaryHostProtocol() {
  static const LinkInterface interface(_KTStorixHostProtocol());
  return interface;
}

const LinkInterface &_KTStorixExtensionHostContext::_extensionAuxiliaryVendorProtocol() {
  static const LinkInterface interface(_KTStorixVendorProtocol().description());
  return interface;
}

ExtensionContextClass _KTStorixExtensionHostContext::contextClass() {
  return {&_extensionAuxiliaryHostProtocol, &_extensionAuxiliaryVendorProtocol,
          [](std::shared_ptr<AuxiliaryConnection> connection) -> std::shared_ptr<ExtensionContext> {
            return std::make_shared<_KTStorixExtensionHostContext>(std::move(connection));
          }};
}

}  // namespace storix
