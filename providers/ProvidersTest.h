#pragma once

#include <gmock/gmock.h>

#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "platform/Log.h"
#include "platform/ProtocolTable.h"
#include "platform/fake/FakeHostTest.h"
#include "providers/SXExtensionStorix.h"
#include "providers/_KTStorixExtensionHostContext.h"

namespace storix {

/// What a row of a protocol must say of an operation.
struct ExpectedRow {
  std::string_view name;
  std::vector<ValueKind> arguments;
  std::vector<ValueKind> replies;
};

/// Whether the protocol has these operations, in this order, and no others.
inline void expectRows(const ProtocolDescription &protocol, const std::vector<ExpectedRow> &rows) {
  const auto kinds = [](const std::vector<ArgumentDescription> &arguments) {
    std::vector<ValueKind> list;
    list.reserve(arguments.size());
    for (const ArgumentDescription &argument : arguments) list.push_back(argument.kind);
    return list;
  };
  ASSERT_EQ(protocol.operations.size(), rows.size());
  for (std::size_t i = 0; i < rows.size(); ++i) {
    EXPECT_EQ(protocol.operations[i].name, rows[i].name);
    EXPECT_EQ(kinds(protocol.operations[i].arguments), rows[i].arguments) << rows[i].name;
    EXPECT_EQ(kinds(protocol.operations[i].replies), rows[i].replies) << rows[i].name;
  }
}

/// The operations of a protocol as they stand on the wire, a line each: "Method(argument) -> (reply)".
inline std::string words(const ProtocolDescription &protocol) {
  const auto list = [](const std::vector<ArgumentDescription> &arguments) {
    std::string text;
    for (const ArgumentDescription &argument : arguments) {
      text += (text.empty() ? "" : ", ") + std::string(argument.name);
    }
    return "(" + text + ")";
  };
  std::string text;
  for (const OperationDescription &operation : protocol.operations) {
    text += std::string(operation.method) + list(operation.arguments) + " -> " + list(operation.replies) + "\n";
  }
  return text;
}

/// A fake host that knows the context class of provider extensions, and words for its trace.
class ProvidersTest : public fake::FakeHostTest {
 protected:
  explicit ProvidersTest(fake::FakePlatform::Options options = {}) : FakeHostTest(std::move(options)) {
    platform().registerExtensionContextClass(_KTStorixExtensionHostContext::name,
                                             _KTStorixExtensionHostContext::contextClass());
    platform().trace().take();
  }

  /// Installs a complete provider and makes the object for it; what that did is not in the trace.
  std::shared_ptr<SXExtensionStorix> makeProvider(const std::string &identifier) {
    const fake::FakeExtension extension = fake::completeProvider(identifier);
    platform().extensions().install(extension);
    std::shared_ptr<SXExtensionStorix> provider =
        SXExtensionStorix::initWithExtension(platform().extensions().makeRecord(extension));
    platform().trace().take();
    platform().log().take();
    return provider;
  }

  /// Brings the registry up with complete providers, their directories made; the trace is emptied.
  void startRegistry(const std::vector<std::string> &identifiers) {
    for (const std::string &identifier : identifiers) {
      platform().extensions().install(fake::completeProvider(identifier));
      platform().files().makeDirectory(storagePath(identifier));
    }
    SXExtensionStorix::createInstancesCompletion({});
    runUntilIdle();
    platform().trace().take();
    platform().log().take();
  }

  std::vector<std::string> trace() { return platform().trace().take(); }
  std::vector<std::string> logTexts() { return platform().log().texts(); }
  fake::FakeExtensionProcess &process(const std::string &identifier) {
    return platform().extensions().process(identifier);
  }

  /// A handler that enters in the trace what it gets and where it runs: "done ((null), x) on ...".
  template <class... Values>
  CompletionHandler<Values...> recording(std::string name) {
    return [&trace = platform().trace(), name = std::move(name)](std::optional<Values>... values) {
      trace.add(name + " " + fake::traced(packArguments<Values...>(std::move(values)...)) + " on " +
                fake::currentContext());
    };
  }

  static std::string storagePath(const std::string &identifier) {
    return "/groups/group." + identifier + "/Storix Storage";
  }
  static std::string storageText(const std::string &identifier) {
    return "file:///groups/group." + identifier + "/Storix%20Storage/";
  }
  static URL storageURL(const std::string &identifier) { return *URL::fromString(storageText(identifier)); }
  static URL itemURL(const std::string &identifier, const std::string &name) {
    return storageURL(identifier).appendingPathComponent(name);
  }

  /// An error as a log line and the trace show it.
  static std::string text(const SXError &error) { return escapedForLog(logDescription(error)); }
  static SXError someError(const std::string &description) {
    return SXError("org.sample.errors", 7, {{"description", description}});
  }

  static std::vector<std::string> joined(std::initializer_list<std::vector<std::string>> parts) {
    std::vector<std::string> all;
    for (const std::vector<std::string> &part : parts) all.insert(all.end(), part.begin(), part.end());
    return all;
  }

  /// One message to a provider and its answer. Requests 1 and 2 were the registrations.
  static std::vector<std::string> message(const std::string &operation, const std::string &provider,
                                          const std::string &request, const std::string &name,
                                          const std::string &subject, const std::string &answer) {
    return {"log debug [DEBUG] -[SXExtensionStorix " + operation + "]",
            "beginExtensionRequest " + provider + " version 1 " + request,
            "begun " + request,
            "log debug [DEBUG] Beginning extension request.",
            "extensionContextForRequest " + provider + " version 1 " + request,
            "remoteProxyWithErrorHandler " + request,
            "send " + request + " " + name + " (" + subject + ")",
            "answer " + request + " " + name + " " + answer};
  }
  static std::string cancel(const std::string &provider, const std::string &request) {
    return "cancelExtensionRequest " + provider + " version 1 " + request;
  }
  /// A request to a provider that cannot be begun: `line` is the operation's own, up to the provider.
  static std::vector<std::string> failedBegin(const std::string &operation, const std::string &provider,
                                              const std::string &request, const std::string &line,
                                              const SXError &error) {
    return {"log debug [DEBUG] -[SXExtensionStorix " + operation + "]",
            "beginExtensionRequest " + provider + " version 1 " + request,
            "begin failed " + request + " " + text(error),
            "log debug [DEBUG] Beginning extension request.",
            "log fault [ERROR] Extension request failed. Error: " + text(error),
            "log fault [ERROR] " + line + " for extension " + provider + ". Error: " + text(error)};
  }
  /// A provider is asked for an item's identifier, and gives it.
  static std::vector<std::string> identification(const std::string &provider, const std::string &request,
                                                 const URL &url) {
    return joined({message("itemIDForURL:completionHandler:", provider, request,
                           "_identifierForItemAtURL:completion:", url.absoluteString(), "((null), f/i)"),
                   {"log debug [DEBUG] Successfully got item ID “f/i” for URL " + url.absoluteString() +
                    " from extension " + provider}});
  }
  /// A provider is asked for an item's identifier, and answers an error; `answer` is all of its answer.
  static std::vector<std::string> failedIdentification(const std::string &provider, const std::string &request,
                                                       const URL &url, const std::string &answer,
                                                       const SXError &error) {
    return joined({message("itemIDForURL:completionHandler:", provider, request,
                           "_identifierForItemAtURL:completion:", url.absoluteString(), answer),
                   {"log fault [ERROR] Proxy failed to get item ID for URL " + url.absoluteString() +
                    " for extension " + provider + ". Error: " + text(error)}});
  }
};

}  // namespace storix
