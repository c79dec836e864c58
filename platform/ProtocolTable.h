#pragma once

#include <array>
#include <functional>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <tuple>
#include <utility>
#include <vector>

#include "platform/Protocol.h"
#include "platform/SXError.h"

namespace storix {

/// How a C++ type that may stand in an operation is carried: its kind, and the way in and out of a
/// `Value`.
template <class T>
struct ArgumentType;

template <>
struct ArgumentType<std::string> {
  static constexpr ValueKind kind = ValueKind::string;
  static const std::string *in(const Value &value) { return value.string(); }
};
template <>
struct ArgumentType<URL> {
  static constexpr ValueKind kind = ValueKind::URL;
  static const URL *in(const Value &value) { return value.url(); }
};
template <>
struct ArgumentType<Data> {
  static constexpr ValueKind kind = ValueKind::data;
  static const Data *in(const Value &value) { return value.data(); }
};
template <>
struct ArgumentType<Dictionary> {
  static constexpr ValueKind kind = ValueKind::dictionary;
  static const Dictionary *in(const Value &value) { return value.dictionary(); }
};
template <>
struct ArgumentType<SXError> {
  static constexpr ValueKind kind = ValueKind::error;
  static const SXError *in(const Value &value) { return value.error(); }
};

/// A completion handler with the reply's values in order; empty where nobody waits.
template <class... Replies>
using CompletionHandler = std::function<void(std::optional<Replies>...)>;

/// An argument as the operation takes it. An index past the end, and a value of another kind, count
/// as absent; the wire refuses both before they get here.
template <class T>
std::optional<T> argumentAt(const Arguments &arguments, std::size_t index) {
  if (index >= arguments.size() || !arguments[index]) return std::nullopt;
  const T *value = ArgumentType<T>::in(*arguments[index]);
  return value ? std::optional<T>(*value) : std::nullopt;
}

template <class... Ts>
Arguments packArguments(std::optional<Ts>... values) {
  Arguments packed;
  packed.reserve(sizeof...(Ts));
  (packed.push_back(values ? Argument(Value(std::move(*values))) : Argument()), ...);
  return packed;
}

/// The reply handler that unpacks the values for `handler`; empty when `handler` is.
template <class... Replies>
ReplyHandler unpackingReply(CompletionHandler<Replies...> handler) {
  if (!handler) return {};
  return [handler = std::move(handler)](Arguments values) {
    [&]<std::size_t... I>(std::index_sequence<I...>) { handler(argumentAt<Replies>(values, I)...); }
    (std::index_sequence_for<Replies...>{});
  };
}

/// The completion handler that packs its values for `reply`; empty when `reply` is.
template <class... Replies>
CompletionHandler<Replies...> packingCompletion(ReplyHandler reply) {
  if (!reply) return {};
  return [reply = std::move(reply)](std::optional<Replies>... values) {
    reply(packArguments<Replies...>(std::move(values)...));
  };
}

/// One protocol of the abstract class `P`: its description, and for each row the way to call the
/// member function. The kinds come from the function's own type, so that a row names only the words.
template <class P>
class ProtocolTable {
 public:
  ProtocolTable(std::string_view name, std::string_view interfaceName, std::string_view objectPath)
      : description_{name, interfaceName, objectPath, {}} {}

  /// Adds the row of one operation: a function that takes optional arguments and, last, a completion
  /// handler. `names` are those of the arguments, then those of the reply.
  template <class... Parameters>
  ProtocolTable &&row(std::string_view name, std::string_view method, void (P::*function)(Parameters...),
                      std::initializer_list<std::string_view> names) && {
    using Taken = std::tuple<Parameters...>;
    constexpr std::size_t argumentCount = sizeof...(Parameters) - 1;
    using Reply = ReplyOf<std::tuple_element_t<argumentCount, Taken>>;
    OperationDescription operation{name, method, {}, {}};
    auto nextName = names.begin();
    [&]<std::size_t... I>(std::index_sequence<I...>) {
      (operation.arguments.push_back({*nextName++, CarriedBy<std::tuple_element_t<I, Taken>>::kind}), ...);
    }
    (std::make_index_sequence<argumentCount>{});
    for (ValueKind kind : Reply::kinds) operation.replies.push_back({*nextName++, kind});
    description_.operations.push_back(std::move(operation));
    invokers_.push_back([function](P &object, const Arguments &arguments, ReplyHandler reply) {
      [&]<std::size_t... I>(std::index_sequence<I...>) {
        (object.*function)(argumentAt<typename std::tuple_element_t<I, Taken>::value_type>(arguments, I)...,
                           Reply::packing(std::move(reply)));
      }
      (std::make_index_sequence<argumentCount>{});
    });
    return std::move(*this);
  }

  [[nodiscard]] const ProtocolDescription &description() const { return description_; }

  /// Calls the operation of that index; an index that is no row is ignored.
  void invoke(std::size_t operation, P &object, const Arguments &arguments, ReplyHandler reply) const {
    if (operation < invokers_.size()) invokers_[operation](object, arguments, std::move(reply));
  }

 private:
  template <class Optional>
  using CarriedBy = ArgumentType<typename Optional::value_type>;

  template <class Handler>
  struct ReplyOf;
  template <class... Rs>
  struct ReplyOf<std::function<void(std::optional<Rs>...)>> {
    static constexpr std::array<ValueKind, sizeof...(Rs)> kinds{ArgumentType<Rs>::kind...};
    static CompletionHandler<Rs...> packing(ReplyHandler reply) { return packingCompletion<Rs...>(std::move(reply)); }
  };

  ProtocolDescription description_;
  std::vector<std::function<void(P &, const Arguments &, ReplyHandler)>> invokers_;
};

/// Turns incoming operations of a protocol into calls on an object of its abstract class.
template <class P>
class ProtocolExporter : public ExportedObject {
 public:
  /// `table` must outlive the exporter; the exporter owns its share of `object`.
  ProtocolExporter(const ProtocolTable<P> &table, std::shared_ptr<P> object)
      : table_(table), object_(std::move(object)) {}

  void invoke(std::size_t operation, Arguments arguments, ReplyHandler reply) override {
    table_.invoke(operation, *object_, arguments, std::move(reply));
  }

 private:
  const ProtocolTable<P> &table_;
  std::shared_ptr<P> object_;
};

}  // namespace storix
