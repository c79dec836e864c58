#include "tools/storixctl/Commands.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <fstream>
#include <memory>
#include <ostream>
#include <utility>

#include "tools/storixctl/Grants.h"
#include "tools/storixctl/Json.h"
#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Requests.h"

namespace storix::ctl {

namespace {

/// Copies everything from the descriptor's beginning. The number of bytes, or what failed.
Result<std::int64_t> copyContent(int descriptor, std::ostream &to) {
  auto buffer = std::make_unique<std::array<char, std::size_t{256} << 10>>();
  std::int64_t size = 0;
  for (;;) {
    const ssize_t count = ::read(descriptor, buffer->data(), buffer->size());
    if (count < 0 && errno == EINTR) continue;
    if (count < 0) return posixError(errno, "reading the document");
    if (count == 0) break;
    if (!to.write(buffer->data(), count)) return posixError(EIO, "writing the document's content");
    size += count;
  }
  if (!to.flush()) return posixError(EIO, "writing the document's content");
  return size;
}

Result<Printed> openDocument(const Invocation &invocation, Client &client, std::ostream &out) {
  const auto token = fromBase64(invocation.operands[0]);
  if (!token) return posixError(EINVAL, "reading the token: it must be base64 text, as extend and resolve print it");
  const auto opened = client.open(*token);
  if (!opened) return opened.error();
  const std::string *output = invocation.value(Option::output);
  if (!output) {
    const auto copied = copyContent(opened.value().get(), out);
    if (!copied) return copied.error();
    return Printed{{}, ""};
  }
  std::ofstream file(*output, std::ios::binary | std::ios::trunc);
  if (!file) return posixError(errno, "opening " + *output);
  const auto copied = copyContent(opened.value().get(), file);
  if (!copied) return copied.error();
  return Printed{{{"output", *output}, {"size", copied.value()}}, ""};
}

Result<Printed> carryOut(const Invocation &invocation, Client &client, Surroundings &surroundings) {
  switch (invocation.verb->verb) {
    case Verb::open:
      return openDocument(invocation, client, surroundings.out);
    case Verb::grants:
      return grants(invocation, surroundings.homeDirectory, surroundings.outputIsTerminal);
    default:
      return request(invocation, client, surroundings);
  }
}

}  // namespace

std::string printable(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return (c >= 0 && c < ' ') || c == 0x7f; }, '?');
  return text;
}

ExitStatus runCommand(const Invocation &invocation, Client &client, Surroundings &surroundings) {
  std::ostream &out = surroundings.out;
  std::ostream &err = surroundings.err;
  const auto printed = carryOut(invocation, client, surroundings);
  if (!printed) {
    if (invocation.json) out << jsonText({{"error", printed.error()}}) << std::flush;
    err << "storixctl: " << invocation.verb->name << ": " << errorLine(printed.error()) << std::endl;
    return exitStatusOf(printed.error());
  }
  out << (invocation.json ? jsonText(printed.value().json) : printed.value().text) << std::flush;
  if (!out) {
    err << "storixctl: " << invocation.verb->name << ": the result could not be written" << std::endl;
    return requestFailed;
  }
  return done;
}

ExitStatus exitStatusOf(const SXError &error) {
  const bool unreachable = isClientError(error, ClientErrorCode::notReachable) ||
                           isClientError(error, ClientErrorCode::connectionLost) ||
                           isClientError(error, ClientErrorCode::timedOut);
  return unreachable ? daemonNotReachable : requestFailed;
}

std::string errorLine(const SXError &error) {
  std::string line = error.message();
  for (const SXError *under = error.underlyingError(); under; under = under->underlyingError()) {
    if (line.find(under->message()) == std::string::npos) line += " [" + under->message() + "]";
  }
  return printable(std::move(line));
}

}  // namespace storix::ctl
