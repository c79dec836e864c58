// A provider that does as it is told by the file "script" in its bundle, one line a step:
//
//   OPERATION ACTION [ARGUMENT]
//
// OPERATION is setup, identifier, url, placeholder, start, stop or changed. ACTION is one of
//   fail TEXT     answer an error with that text
//   hold FIFO     say "holding OPERATION" on stderr, wait until somebody writes to the FIFO, go on;
//                 it must lie in the group container, where the provider sees it
//   exit STATUS   end the process at once
//   never         never answer
//   claim PATH    claim that file of its own for reading and then for writing, say "claimed", go on
// An operation without a line does its work: the item's identifier is its path below the storage, and
// starting to provide it writes "contents of IDENTIFIER" there. On stderr the process says "process PID"
// when it starts, and every call "called OPERATION".

#include <unistd.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <sstream>
#include <vector>

#include "storix/FileCoordinator.h"
#include "storix/ProviderExtension.h"

namespace {

using storix::SXError;
using storix::URL;

struct Step {
  std::string operation;
  std::string action;
  std::string argument;
};

std::vector<Step> readScript(const std::string &bundlePath) {
  std::vector<Step> steps;
  std::ifstream script(bundlePath + "/script");
  for (std::string line; std::getline(script, line);) {
    std::istringstream words(line);
    Step step;
    words >> step.operation >> step.action >> std::ws;
    std::getline(words, step.argument);
    if (!step.operation.empty()) steps.push_back(step);
  }
  return steps;
}

class ScriptedProvider : public storix::ProviderExtension {
 public:
  explicit ScriptedProvider(const storix::ProviderEnvironment &given)
      : ProviderExtension(given), steps_(readScript(given.bundlePath)) {}

  void performInitialSetup(Completion completion) override {
    if (follows("setup", completion)) ProviderExtension::performInitialSetup(std::move(completion));
  }

  void itemIdentifier(const URL &url, IdentifierCompletion completion) override {
    if (follows("identifier", completion)) ProviderExtension::itemIdentifier(url, std::move(completion));
  }

  void itemURL(const std::string &identifier, URLCompletion completion) override {
    if (follows("url", completion)) ProviderExtension::itemURL(identifier, std::move(completion));
  }

  void providePlaceholder(const URL &url, URLCompletion completion) override {
    if (!follows("placeholder", completion)) return;
    const URL placeholder = url.deletingLastPathComponent().appendingPathComponent("." + url.lastPathComponent());
    write(placeholder.path(), "placeholder");
    completion(placeholder);
  }

  void startProviding(const URL &url, Completion completion) override {
    if (!follows("start", completion)) return;
    write(url.path(), "contents of " + relativePath(url).value_or("nothing of ours"));
    completion(std::nullopt);
  }

  void stopProviding(const URL &url, Completion completion) override {
    if (!follows("stop", completion)) return;
    std::filesystem::remove(url.path());
    completion(std::nullopt);
  }

  void itemChanged(const URL &url, Completion completion) override {
    if (!follows("changed", completion)) return;
    std::fprintf(stderr, "changed %s\n", relativePath(url).value_or("nothing of ours").c_str());
    completion(std::nullopt);
  }

 private:
  /// Does the script's steps for an operation; true when the work itself is still to be done.
  template <class AnyCompletion>
  bool follows(const std::string &operation, AnyCompletion &completion) {
    std::fprintf(stderr, "called %s\n", operation.c_str());
    for (const Step &step : steps_) {
      if (step.operation != operation) continue;
      if (step.action == "fail") {
        completion(SXError("org.sample.scripted", 1, {{"description", step.argument}}));
        return false;
      }
      if (step.action == "exit") ::_exit(std::atoi(step.argument.c_str()));
      if (step.action == "never") {
        const std::lock_guard lock(mutex_);
        kept_.push_back([completion] { (void)completion; });
        return false;
      }
      if (step.action == "hold") {
        std::fprintf(stderr, "holding %s\n", operation.c_str());
        std::ifstream fifo(step.argument);
        fifo.get();
      }
      if (step.action == "claim") claim(step.argument);
    }
    return true;
  }

  /// As any other process would; the text says what came of it.
  static void claim(const std::string &path) {
    const storix::ClaimOptions patience{.deadline = std::chrono::seconds(30)};
    storix::FileCoordinator coordinator;
    const URL url = *URL::fileURLWithPath(path);
    for (const bool writing : {false, true}) {
      auto claim = writing ? coordinator.write(url, patience) : coordinator.read(url, patience);
      const auto error = claim ? claim.value().end() : std::optional(claim.error());
      if (error) {
        std::fprintf(stderr, "not claimed: %s\n", error->message().c_str());
        return;
      }
    }
    std::fprintf(stderr, "claimed\n");
  }

  static void write(const std::string &path, const std::string &content) {
    const std::filesystem::path target(path);
    std::filesystem::create_directories(target.parent_path());
    const std::filesystem::path temporary = target.parent_path() / (".new-" + target.filename().string());
    std::ofstream(temporary, std::ios::binary) << content;
    std::filesystem::rename(temporary, target);
  }

  const std::vector<Step> steps_;
  std::mutex mutex_;
  std::vector<std::function<void()>> kept_;
};

}  // namespace

int main() {
  std::fprintf(stderr, "process %d\n", ::getpid());
  return storix::runProviderExtension<ScriptedProvider>();
}
