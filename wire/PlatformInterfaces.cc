#include "wire/PlatformInterfaces.h"

namespace storix::wire {

const InterfaceDescription &fileCoordinationInterface() {
  static const InterfaceDescription interface {
    "com.tessel.Platform.FileCoordination", platformObjectPath, {
      {"BeginRead", {{"URL", "s"}, {"readerID", "as"}}, {{"error", "a(sxa{sv})"}, {"claim", "at"}}},
          {"EndRead", {{"claim", "t"}}, {}},
          {"BeginWrite", {{"URL", "s"}, {"writerID", "as"}}, {{"error", "a(sxa{sv})"}, {"claim", "at"}}}, {
        "EndWrite", {{"claim", "t"}}, {}
      }
    }
  };
  return interface;
}

const InterfaceDescription &sandboxInterface() {
  static const InterfaceDescription interface {
    "com.tessel.Platform.Sandbox", platformObjectPath, {
      {"Consume", {{"tokenData", "ay"}}, {{"fileDescriptor", "h"}}}, {
        "ProveWriteAccess", {{"fileDescriptor", "h"}}, {}
      }
    }
  };
  return interface;
}

const InterfaceDescription &notificationsInterface() {
  static const InterfaceDescription interface {
    "com.tessel.Platform.Notifications", platformObjectPath, {
      {
        "Post", {{"name", "s"}}, {}
      }
    }
  };
  return interface;
}

}  // namespace storix::wire
