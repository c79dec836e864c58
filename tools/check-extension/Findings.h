#pragma once

#include <string>
#include <utility>
#include <vector>

namespace storix::check {

/// An error makes documents unreachable, or worse; advice is about what could be better.
enum class Severity { error, advice };

/// One thing that is wrong with a provider, in words for its author.
struct Finding {
  Severity severity;
  std::string sentence;
  friend bool operator==(const Finding &, const Finding &) = default;
};

/// What a check has found so far, in order; a thing that is found twice stands in it once.
class Findings {
 public:
  void error(std::string sentence) { add({Severity::error, std::move(sentence)}); }
  void advice(std::string sentence) { add({Severity::advice, std::move(sentence)}); }

  [[nodiscard]] const std::vector<Finding> &all() const { return all_; }
  [[nodiscard]] std::size_t count(Severity severity) const {
    std::size_t number = 0;
    for (const Finding &finding : all_) number += finding.severity == severity ? 1U : 0U;
    return number;
  }

 private:
  void add(Finding finding) {
    for (const Finding &known : all_) {
      if (known == finding) return;
    }
    all_.push_back(std::move(finding));
  }

  std::vector<Finding> all_;
};

}  // namespace storix::check
