#pragma once

#include <span>
#include <string_view>
#include <vector>

namespace storix::ctl {

enum class Verb {
  wake,
  providers,
  read,
  cat,
  write,
  extend,
  placeholder,
  start,
  stop,
  open,
  share,
  bookmark,
  resolve,
  grants,
  notify,
  checkExtension
};

enum class Option { json, timeout, help, output, input, provider, consumer, item, file, container };

struct OptionDescription {
  Option option;
  std::string_view name;       ///< "--output"
  std::string_view shortName;  ///< "-o", or empty
  std::string_view value;      ///< what its value is, as in "FILE"; empty for one that takes none
  std::string_view meaning;    ///< one line
  bool mayBeRepeated = false;  ///< else the last one counts
};

/// All options, those of every verb first.
std::span<const OptionDescription> options();

/// Null when there is none of that name; `name` is the long or the short one.
const OptionDescription *optionNamed(std::string_view name);

/// Whether every verb takes it.
bool isCommon(Option option);

struct OperandDescription {
  std::string_view name;
  std::string_view meaning;
};

struct VerbDescription {
  Verb verb;
  std::string_view name;
  std::string_view summary;  ///< one line
  std::string_view details;  ///< what it needs and what it prints
  std::vector<OperandDescription> operands;
  std::vector<Option> options = {};  ///< beside those of every verb

  [[nodiscard]] bool takes(Option option) const;
};

/// All verbs, in the order of the help.
std::span<const VerbDescription> verbs();

/// Null when there is none of that name.
const VerbDescription *verbNamed(std::string_view name);

}  // namespace storix::ctl
