#include "tools/storixctl/Commands.h"

#include <unistd.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <fstream>
#include <memory>
#include <ostream>
#include <utility>

#include "tools/storixctl/Json.h"

namespace storix::ctl {

namespace {

/// What a verb gives: the same thing for programs and for people.
struct Printed {
  Dictionary json;
  std::string text;
};

/// Names and paths come from elsewhere and could hold what a terminal obeys.
std::string printable(std::string text) {
  std::replace_if(
      text.begin(), text.end(), [](char c) { return (c >= 0 && c < ' ') || c == 0x7f; }, '?');
  return text;
}

Result<Printed> outcome(const std::optional<SXError> &error) {
  if (error) return *error;
  return Printed{{{"done", true}}, ""};
}

Result<Printed> bookmarkableString(const std::string &string) {
  return Printed{{{"bookmarkableString", string}}, printable(string) + "\n"};
}

Result<Printed> grantedDocument(const Result<GrantedDocument> &granted) {
  if (!granted) return granted.error();
  const GrantedDocument &document = granted.value();
  Printed printed{{{"URL", document.url}}, "URL              " + document.url.absoluteString() + "\n"};
  if (document.token) {
    printed.json.emplace("token", *document.token);
    printed.text += "token            " + base64(*document.token) + "\n";
  }
  if (document.companionURL) {
    printed.json.emplace("companionURL", *document.companionURL);
    printed.text += "companion URL    " + document.companionURL->absoluteString() + "\n";
  }
  if (document.companionToken) {
    printed.json.emplace("companionToken", *document.companionToken);
    printed.text += "companion token  " + base64(*document.companionToken) + "\n";
  }
  return printed;
}

Result<Printed> providerList(const Result<std::vector<ProviderDescription>> &providers) {
  if (!providers) return providers.error();
  List list;
  std::string text;
  for (const ProviderDescription &provider : providers.value()) {
    Dictionary entry{{"identifier", provider.identifier}};
    if (provider.documentStorageURL) entry.emplace("documentStorageURL", *provider.documentStorageURL);
    list.emplace_back(std::move(entry));
    const std::string directory = provider.documentStorageURL ? provider.documentStorageURL->path() : "";
    text += printable(provider.identifier) + "\t" + printable(directory) + "\n";
  }
  return Printed{{{"providers", std::move(list)}}, std::move(text)};
}

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
  if (!invocation.output) {
    const auto copied = copyContent(opened.value().get(), out);
    if (!copied) return copied.error();
    return Printed{{}, ""};
  }
  std::ofstream file(*invocation.output, std::ios::binary | std::ios::trunc);
  if (!file) return posixError(errno, "opening " + *invocation.output);
  const auto copied = copyContent(opened.value().get(), file);
  if (!copied) return copied.error();
  return Printed{{{"output", *invocation.output}, {"size", copied.value()}}, ""};
}

/// The verbs that speak of a document, on behalf of a consumer or not.
Result<Printed> documentVerb(const Invocation &invocation, Client &client, const std::string &currentDirectory) {
  const auto &operands = invocation.operands;
  const auto document = documentURL(operands[0], currentDirectory);
  if (!document) return document.error();
  const URL &url = document.value();
  switch (invocation.verb->verb) {
    case Verb::extend:
      return grantedDocument(client.extendSandbox(url, operands[1], operands[2]));
    case Verb::placeholder:
      return outcome(client.providePlaceholder(url, operands[1], operands[2]));
    case Verb::start:
      return outcome(client.startProviding(url, operands[1], operands[2]));
    case Verb::stop:
      return outcome(client.stopProviding(url, operands[1], operands[2]));
    case Verb::share: {
      const auto string = client.extendBookmark(url, operands[1]);
      return string ? bookmarkableString(string.value()) : Result<Printed>(string.error());
    }
    default: {
      const auto string = client.bookmarkableString(url);
      if (!string) return string.error();
      if (!string.value()) return SXNotFoundErrorURL(url);
      return bookmarkableString(*string.value());
    }
  }
}

Result<Printed> carryOut(const Invocation &invocation, Client &client, const std::string &currentDirectory,
                         std::ostream &out) {
  switch (invocation.verb->verb) {
    case Verb::wake:
      return outcome(client.wakeUp());
    case Verb::providers:
      return providerList(client.providers());
    case Verb::open:
      return openDocument(invocation, client, out);
    case Verb::resolve:
      return grantedDocument(client.resolveBookmark(invocation.operands[0]));
    case Verb::notify:
      return outcome(client.postNotification(invocation.operands[0]));
    default:
      return documentVerb(invocation, client, currentDirectory);
  }
}

}  // namespace

ExitStatus runCommand(const Invocation &invocation, Client &client, const std::string &currentDirectory,
                      std::ostream &out, std::ostream &err) {
  const auto printed = carryOut(invocation, client, currentDirectory, out);
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
