#include "tools/storixctl/BundleCheck.h"

#include <cstdint>
#include <filesystem>
#include <ostream>
#include <utility>

#include "tools/check-extension/CheckExtension.h"

namespace storix::ctl {

namespace {

std::string absolutePath(const std::string &path, const std::string &currentDirectory) {
  std::string normal = (std::filesystem::path(currentDirectory) / path).lexically_normal().string();
  while (normal.size() > 1 && normal.ends_with('/')) normal.pop_back();
  return normal;
}

std::string counted(std::int64_t number, const std::string &one, const std::string &many) {
  return std::to_string(number) + " " + (number == 1 ? one : many);
}

}  // namespace

Result<Printed> checkBundle(const Invocation &invocation, const Surroundings &surroundings) {
  check::ExtensionCheck asked;
  asked.bundle = absolutePath(invocation.operands[0], surroundings.currentDirectory);
  asked.items = invocation.allValues(Option::item);
  asked.files = invocation.allValues(Option::file);
  if (const std::string *container = invocation.value(Option::container)) {
    asked.container = absolutePath(*container, surroundings.currentDirectory);
  }
  asked.timeout = invocation.timeout;
  asked.takeOutputLine = [&err = surroundings.err](std::string_view line) {
    err << "provider: " << printable(std::string(line)) << std::endl;
  };
  const auto findings = check::checkExtension(asked);
  if (!findings) return findings.error();

  Printed printed;
  List list;
  std::int64_t errors = 0;
  for (const check::Finding &finding : findings.value()) {
    const bool isError = finding.severity == check::Severity::error;
    errors += isError ? 1 : 0;
    list.emplace_back(Dictionary{{"severity", isError ? "error" : "advice"}, {"text", finding.sentence}});
    printed.text += (isError ? "error:  " : "advice: ") + printable(finding.sentence) + "\n";
  }
  const bool documentsTried = !asked.items.empty() || !asked.files.empty();
  const std::int64_t advice = static_cast<std::int64_t>(findings.value().size()) - errors;
  printed.text +=
      counted(errors, "error", "errors") + ", " + counted(advice, "piece of advice", "pieces of advice") + "\n";
  if (!documentsTried) {
    printed.text +=
        "Only bad input was tried, since no document of the provider is known: name some with --item or\n"
        "--file.\n";
  }
  printed.isFailure = errors > 0;
  printed.json = {{"bundle", asked.bundle},
                  {"documentsTried", documentsTried},
                  {"errors", errors},
                  {"findings", std::move(list)},
                  {"advice", advice}};
  return printed;
}

}  // namespace storix::ctl
