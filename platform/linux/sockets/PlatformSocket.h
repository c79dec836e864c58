#pragma once

#include "platform/linux/Notifications.h"
#include "platform/linux/coordination/FileCoordination.h"
#include "platform/linux/identity/Sandbox.h"
#include "platform/linux/sockets/NamedSockets.h"

namespace storix::linuxhost {

/// The host's own services, which the platform socket offers to every process. They outlive the socket.
struct PlatformFacilities {
  FileCoordination &fileCoordination;
  Sandbox &sandbox;
  Notifications &notifications;
};

/// Serves the socket "com.tessel.Platform": file coordination, the sandbox and notifications. What a
/// connection has claimed and proved ends with it.
void servePlatformSocket(NamedSocket &socket, const PlatformFacilities &facilities);

}  // namespace storix::linuxhost
