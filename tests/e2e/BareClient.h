#pragma once

#include <gtest/gtest.h>
#include <systemd/sd-bus.h>

#include <chrono>
#include <cstdint>
#include <cstring>
#include <optional>
#include <string>
#include <vector>

#include "tests/e2e/Process.h"

namespace storix::e2e {

/// A D-Bus client without any of our code, for what our own would not send. Used by one thread.
class BareClient {
 public:
  /// The object and the interface that it calls.
  struct Service {
    const char *path;
    const char *interface;
  };
  static constexpr Service daemon{"/com/tessel/Storix", "com.tessel.Storix.Daemon"};
  static constexpr Service fileCoordination{"/com/tessel/Platform", "com.tessel.Platform.FileCoordination"};

  /// What a request to begin a claim came to.
  struct Begun {
    std::string errorName;  ///< Of a D-Bus error.
    std::string errorText;
    std::string providerError;  ///< The domain of the error that the provider answered.
    std::optional<std::uint64_t> claim;
  };

  explicit BareClient(const std::string &socket, Service service = daemon) : service_(service) {
    EXPECT_GE(sd_bus_new(&bus_), 0);
    EXPECT_GE(sd_bus_set_address(bus_, ("unix:path=" + socket).c_str()), 0);
    EXPECT_GE(sd_bus_start(bus_), 0);
    EXPECT_GE(sd_bus_set_method_call_timeout(bus_, std::chrono::microseconds(deadline).count()), 0);
  }
  ~BareClient() { sd_bus_flush_close_unref(bus_); }
  BareClient(const BareClient &) = delete;
  BareClient &operator=(const BareClient &) = delete;

  /// Calls a method of the service with those arguments; the name of the D-Bus error, or "" for an
  /// answer.
  template <class... Arguments>
  std::string call(const char *method, const char *signature, Arguments... arguments) {
    sd_bus_error error{};
    const int result = sd_bus_call_method(bus_, nullptr, service_.path, service_.interface, method, &error, nullptr,
                                          signature, arguments...);
    std::string name = result < 0 ? (error.name ? error.name : std::strerror(-result)) : "";
    sd_bus_error_free(&error);
    return name;
  }

  /// Sends "BeginRead" or "BeginWrite"; its answer is the next of `answers` when it comes.
  void send(const char *method, const std::string &url) {
    EXPECT_GE(sd_bus_call_method_async(bus_, nullptr, nullptr, service_.path, service_.interface, method,
                                       &BareClient::answered, this, "sas", url.c_str(), 0),
              0);
  }

  /// Waits for that many answers to what was sent, and takes them. Fails the test at the deadline.
  std::vector<Begun> answers(std::size_t count) {
    const auto end = std::chrono::steady_clock::now() + deadline;
    while (answers_.size() < count) {
      const int processed = sd_bus_process(bus_, nullptr);
      if (processed > 0) continue;
      const auto rest = std::chrono::duration_cast<std::chrono::microseconds>(end - std::chrono::steady_clock::now());
      if (processed < 0 || rest.count() <= 0) {
        ADD_FAILURE() << answers_.size() << " answers of " << count;
        break;
      }
      sd_bus_wait(bus_, static_cast<std::uint64_t>(rest.count()));
    }
    return std::exchange(answers_, {});
  }

  /// Sends it and waits for its answer.
  Begun begin(const char *method, const std::string &url) {
    send(method, url);
    std::vector<Begun> answer = answers(1);
    return answer.empty() ? Begun() : answer.front();
  }

 private:
  static int answered(sd_bus_message *message, void *self, sd_bus_error * /*unused*/) {
    Begun begun;
    if (const sd_bus_error *error = sd_bus_message_get_error(message)) {
      begun.errorName = error->name;
      begun.errorText = error->message ? error->message : "";
    } else {
      const char *domain = nullptr;
      EXPECT_GE(sd_bus_message_enter_container(message, 'a', "(sxa{sv})"), 0);
      if (sd_bus_message_enter_container(message, 'r', "sxa{sv}") > 0) {
        EXPECT_GE(sd_bus_message_read(message, "s", &domain), 0);
        begun.providerError = domain;
        EXPECT_GE(sd_bus_message_skip(message, "xa{sv}"), 0);
        EXPECT_GE(sd_bus_message_exit_container(message), 0);
      }
      EXPECT_GE(sd_bus_message_exit_container(message), 0);
      std::uint64_t claim = 0;
      EXPECT_GE(sd_bus_message_enter_container(message, 'a', "t"), 0);
      if (sd_bus_message_read(message, "t", &claim) > 0) begun.claim = claim;
    }
    static_cast<BareClient *>(self)->answers_.push_back(std::move(begun));
    return 1;
  }

  const Service service_;
  sd_bus *bus_ = nullptr;
  std::vector<Begun> answers_;
};

}  // namespace storix::e2e
