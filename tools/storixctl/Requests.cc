#include "tools/storixctl/Requests.h"

#include <utility>

#include "tools/storixctl/Advice.h"
#include "tools/storixctl/Json.h"
#include "tools/storixctl/Table.h"

namespace storix::ctl {

namespace {

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

Result<Printed> providerList(const Result<std::vector<ProviderDescription>> &providers, bool forTerminal) {
  if (!providers) return providers.error();
  List list;
  Table table({"PROVIDER", "DOCUMENTS"});
  for (const ProviderDescription &provider : providers.value()) {
    Dictionary entry{{"identifier", provider.identifier}};
    if (provider.documentStorageURL) entry.emplace("documentStorageURL", *provider.documentStorageURL);
    list.emplace_back(std::move(entry));
    table.add({provider.identifier, provider.documentStorageURL ? provider.documentStorageURL->path() : ""});
  }
  return Printed{{{"providers", std::move(list)}}, table.text(forTerminal)};
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

}  // namespace

Result<Printed> request(const Invocation &invocation, Client &client, const Surroundings &surroundings) {
  switch (invocation.verb->verb) {
    case Verb::wake:
      return outcome(client.wakeUp());
    case Verb::providers:
      return providerList(client.providers(), surroundings.outputIsTerminal);
    case Verb::resolve: {
      const auto granted = client.resolveBookmark(invocation.operands[0]);
      if (!granted) return adviseOnResolving(granted.error(), invocation.operands[0]);
      return grantedDocument(granted);
    }
    case Verb::notify:
      return outcome(client.postNotification(invocation.operands[0]));
    default:
      return documentVerb(invocation, client, surroundings.currentDirectory);
  }
}

}  // namespace storix::ctl
