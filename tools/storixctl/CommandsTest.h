#pragma once

#include <gtest/gtest.h>

#include <memory>
#include <sstream>

#include "sdk/src/TestDaemon.h"
#include "tools/storixctl/Commands.h"
#include "tools/storixctl/SteppedWaiting.h"

namespace storix::ctl {

/// Runs verbs against a daemon that does as the test says, and collects what they print.
class CommandsTest : public ::testing::Test {
 protected:
  /// What the daemon's threads do may use members of the test.
  void TearDown() override { daemon_.reset(); }

  ExitStatus run(const std::vector<std::string> &arguments,
                 std::chrono::milliseconds timeout = std::chrono::seconds(60)) {
    out_.str("");
    err_.str("");
    Invocation invocation = std::get<Invocation>(parseArguments(arguments));
    invocation.timeout = timeout;
    return runCommand(invocation, surroundings_);
  }
  std::shared_ptr<sdk::ScriptedDaemon> scripted() { return daemon_->daemon; }
  std::string printed() const { return out_.str(); }
  std::string complaint() const { return err_.str(); }

  std::unique_ptr<sdk::TestDaemon> daemon_ = std::make_unique<sdk::TestDaemon>();
  std::ostringstream out_;
  std::ostringstream err_;
  SteppedWaiting waiting_;
  Surroundings surroundings_{.currentDirectory = "/storage",
                             .homeDirectory = "",
                             .clientOptions = {.runtimeDirectory = daemon_->directory()},
                             .out = out_,
                             .err = err_,
                             .waiting = waiting_};
};

}  // namespace storix::ctl
