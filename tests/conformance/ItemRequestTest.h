#pragma once

#include <ostream>
#include <string>
#include <string_view>
#include <vector>

#include "service/ServicerTest.h"

namespace storix {

/// One of the three requests about an item, and what is its own.
struct ItemRequestCase {
  const char *label;
  std::string_view name;
  std::string operation;     // of the provider object
  std::string message;       // to the extension
  std::string successLine;   // of the provider object, up to the URL
  std::string failureLine;   // of the provider object, up to the URL
  std::string earlyFailure;  // up to the URL
  bool looksUpByURL;

  friend void PrintTo(const ItemRequestCase &request, std::ostream *out) { *out << request.label; }
};

class ItemRequestsTest : public ServicerTest {
 protected:
  void SetUp() override {
    ServicerTest::SetUp();
    connect({{readEntitlement, true}});
  }

  static constexpr const char *admitted = "entitlementValue peer 100 com.tessel.storix.acl-read";

  void expectEarlyFailure(const ItemRequestCase &request, const Arguments &given,
                          const std::vector<std::string> &lookup, const SXError &error) {
    call(request.name, given);
    const auto argument = [&given](std::size_t i) { return logDescription(given[i]); };
    EXPECT_THAT(trace(), ::testing::ElementsAreArray(
                             joined({served(request.name, given),
                                     {admitted},
                                     lookup,
                                     {"log fault " + request.earlyFailure + " " + argument(0) + " from provider ID " +
                                          argument(1) + " to consumer ID " + argument(2) + ". Error: " + text(error),
                                      reply(request.name, "(" + text(error) + ")", global)}})));
  }
};

inline const ItemRequestCase placeholder{"placeholder",
                                         SXDaemon::providePlaceholderName,
                                         "providePlaceholderForItemAtURL:completionHandler:",
                                         "_providePlaceholderAtURL:completion:",
                                         "[DEBUG] Successfully provided placeholder at URL ",
                                         "[ERROR] Proxy failed to provide placeholder at URL ",
                                         "[ERROR] Could not provide placeholder for URL",
                                         false};
inline const ItemRequestCase start{"start",
                                   SXDaemon::startProvidingName,
                                   "startProvidingItemAtURL:completionHandler:",
                                   "_startProvidingItemAtURL:completion:",
                                   "[DEBUG] Successfully provided item at URL ",
                                   "[ERROR] Proxy failed to start providing item at URL ",
                                   "[ERROR] Cannot provide item at URL",
                                   true};
inline const ItemRequestCase stop{"stop",
                                  SXDaemon::stopProvidingName,
                                  "stopProvidingItemAtURL:completionHandler:",
                                  "_stopProvidingItemAtURL:completion:",
                                  "[DEBUG] Successfully stopped providing item at URL ",
                                  "[ERROR] Proxy failed to stop providing item at URL ",
                                  "[ERROR] Could not stop providing item at URL",
                                  true};

}  // namespace storix
