#include "tools/storixctl/Commands.h"

#include <algorithm>
#include <cerrno>
#include <ostream>
#include <utility>

#include "storix/Client.h"
#include "tools/storixctl/Advice.h"
#include "tools/storixctl/BundleCheck.h"
#include "tools/storixctl/Grants.h"
#include "tools/storixctl/Json.h"
#include "tools/storixctl/Printed.h"
#include "tools/storixctl/Requests.h"
#include "tools/storixctl/Transfers.h"

namespace storix::ctl {

namespace {

bool isReaderGone(const SXError &error) { return error.domain() == posixErrorDomain && error.code() == EPIPE; }

Result<Printed> carryOut(const Invocation &invocation, const Surroundings &surroundings) {
  if (invocation.verb->verb == Verb::grants) {
    return grants(invocation, surroundings.homeDirectory, surroundings.outputIsTerminal);
  }
  if (invocation.verb->verb == Verb::checkExtension) return checkBundle(invocation, surroundings);
  ClientOptions options = surroundings.clientOptions;
  options.timeout = invocation.timeout;
  Client client(options);
  if (movesContent(*invocation.verb)) return moveContent(invocation, client, surroundings);
  return request(invocation, client, surroundings);
}

}  // namespace

std::string printable(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return (c >= 0 && c < ' ') || c == 0x7f; }, '?');
  return text;
}

ExitStatus runCommand(const Invocation &invocation, const Surroundings &surroundings) {
  std::ostream &out = surroundings.out;
  std::ostream &err = surroundings.err;
  const auto printed = carryOut(invocation, surroundings);
  if (!printed) {
    if (surroundings.waiting.isInterrupted()) return static_cast<ExitStatus>(128 + surroundings.waiting.signalNumber());
    if (isReaderGone(printed.error())) return readerGone;
    const SXError error = adviseOnReaching(printed.error());
    if (invocation.json) out << jsonText({{"error", error}}) << std::flush;
    err << "storixctl: " << invocation.verb->name << ": " << errorLine(error) << std::endl;
    return exitStatusOf(error);
  }
  out << (invocation.json ? jsonText(printed.value().json) : printed.value().text) << std::flush;
  if (!out) {
    err << "storixctl: " << invocation.verb->name << ": the result could not be written" << std::endl;
    return requestFailed;
  }
  return printed.value().isFailure ? requestFailed : done;
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
