#include "daemon/SXLinkListenerDelegate.h"

#include <utility>

#include "daemon/SXServer.h"
#include "platform/Log.h"
#include "service/SXDaemon.h"
#include "service/SXLinkServicer.h"

namespace storix {

bool SXLinkListenerDelegate::listener(ServiceListener & /*listener*/,
                                      std::shared_ptr<ClientConnection> shouldAcceptNewConnection) {
  const std::shared_ptr<ClientConnection> &connection = shouldAcceptNewConnection;
  constexpr std::size_t listReplyArgument = 1;
  LinkInterface interface(SXDaemonProtocol().description());
  interface.setPermittedKinds({ValueKind::dictionary, ValueKind::string, ValueKind::URL}, SXDaemon::providersName,
                              listReplyArgument, true);
  connection->setExportedInterface(std::move(interface));

  const auto servicer = std::make_shared<SXLinkServicer>();
  servicer->setServer(server());
  servicer->setConnection(connection);
  connection->setExportedObject(std::make_shared<ProtocolExporter<SXDaemon>>(SXDaemonProtocol(), servicer));
  connection->resume();
  sx_default_log().info("[INFO] New connection accepted.");
  return true;
}

}  // namespace storix
