#include "wire/Introspection.h"

#include <algorithm>

namespace storix::wire {

namespace {

constexpr std::string_view documentType =
    "<!DOCTYPE node PUBLIC \"-//freedesktop//DTD D-BUS Object Introspection 1.0//EN\"\n"
    "\"http://www.freedesktop.org/standards/dbus/1.0/introspect.dtd\">\n";

constexpr std::string_view commonInterfaces =
    " <interface name=\"org.freedesktop.DBus.Peer\">\n"
    "  <method name=\"Ping\"/>\n"
    "  <method name=\"GetMachineId\">\n"
    "   <arg type=\"s\" name=\"machine_uuid\" direction=\"out\"/>\n"
    "  </method>\n"
    " </interface>\n"
    " <interface name=\"org.freedesktop.DBus.Introspectable\">\n"
    "  <method name=\"Introspect\">\n"
    "   <arg type=\"s\" name=\"xml_data\" direction=\"out\"/>\n"
    "  </method>\n"
    " </interface>\n";

void appendArguments(std::string &xml, const std::vector<MethodArgument> &arguments, std::string_view direction) {
  for (const MethodArgument &argument : arguments) {
    xml.append("   <arg type=\"").append(argument.type).append("\" name=\"").append(argument.name);
    xml.append("\" direction=\"").append(direction).append("\"/>\n");
  }
}

void appendInterface(std::string &xml, const InterfaceDescription &interface) {
  xml.append(" <interface name=\"").append(interface.name).append("\">\n");
  for (const MethodDescription &method : interface.methods) {
    xml.append("  <method name=\"").append(method.name);
    if (method.in.empty() && method.out.empty()) {
      xml.append("\"/>\n");
      continue;
    }
    xml.append("\">\n");
    appendArguments(xml, method.in, "in");
    appendArguments(xml, method.out, "out");
    xml.append("  </method>\n");
  }
  xml.append(" </interface>\n");
}

}  // namespace

std::string introspectionXML(std::span<const InterfaceDescription *const> interfaces,
                             std::span<const std::string> children) {
  std::string xml(documentType);
  xml.append("<node>\n").append(commonInterfaces);
  for (const InterfaceDescription *interface : interfaces) appendInterface(xml, *interface);
  for (const std::string &child : children) xml.append(" <node name=\"").append(child).append("\"/>\n");
  xml.append("</node>\n");
  return xml;
}

std::vector<std::string> childrenOf(std::string_view path, std::span<const std::string_view> objectPaths) {
  std::string prefix(path);
  if (!prefix.ends_with('/')) prefix.push_back('/');
  std::vector<std::string> children;
  for (std::string_view objectPath : objectPaths) {
    if (!objectPath.starts_with(prefix) || objectPath.size() == prefix.size()) continue;
    objectPath.remove_prefix(prefix.size());
    std::string child(objectPath.substr(0, objectPath.find('/')));
    if (std::find(children.begin(), children.end(), child) == children.end()) children.push_back(std::move(child));
  }
  return children;
}

}  // namespace storix::wire
