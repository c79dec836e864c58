#include <fcntl.h>
#include <rapidjson/error/en.h>
#include <rapidjson/reader.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cmath>
#include <cstring>
#include <limits>
#include <vector>

#include "platform/linux/files/KeyedValueFile.h"
#include "platform/linux/files/PathText.h"
#include "wire/UniqueFd.h"

namespace storix::linuxhost {
namespace {

constexpr std::size_t chunkBytes = 64 * 1024;

/// The parser's input: a text, or a descriptor that is read in pieces. Knows lines.
class TextStream {
 public:
  using Ch = char;

  explicit TextStream(std::string_view text) : sizeLimit_(keyedValueSizeLimit), chunk_(text) { limit(); }
  TextStream(int fd, std::size_t sizeLimit) : sizeLimit_(sizeLimit), fd_(fd), buffer_(chunkBytes) { readChunk(); }

  [[nodiscard]] char Peek() const { return position_ < chunk_.size() ? chunk_[position_] : '\0'; }
  char Take() {
    if (position_ == chunk_.size()) return '\0';
    const char taken = chunk_[position_++];
    if (position_ == chunk_.size() && fd_ >= 0) readChunk();
    return taken;
  }
  [[nodiscard]] std::size_t Tell() const { return chunkOffset_ + position_; }

  // What the parser asks of a stream that it may write to; it never does.
  char *PutBegin() { return nullptr; }
  void Put(char) {}
  void Flush() {}
  std::size_t PutEnd(char *) { return 0; }

  [[nodiscard]] bool atEnd() const { return position_ == chunk_.size(); }
  [[nodiscard]] bool isTooLarge() const { return tooLarge_; }
  [[nodiscard]] std::size_t sizeLimit() const { return sizeLimit_; }
  [[nodiscard]] int readError() const { return readError_; }

  /// In words, counted from 1. No token spans lines, so an offset in the piece before lies in the
  /// line that was current at its end.
  [[nodiscard]] std::string placeOf(std::size_t offset) const {
    std::size_t line = linesBefore_;
    std::size_t lineStart = lineStart_;
    const std::size_t end = offset > chunkOffset_ ? std::min(offset - chunkOffset_, chunk_.size()) : 0;
    countLines(chunk_.substr(0, end), line, lineStart);
    const std::size_t column = offset - std::min(offset, lineStart);
    return "line " + std::to_string(line + 1) + ", column " + std::to_string(column + 1) + " (byte " +
           std::to_string(offset + 1) + ")";
  }

 private:
  void countLines(std::string_view text, std::size_t &lines, std::size_t &lineStart) const {
    for (std::size_t at = text.find('\n'); at != std::string_view::npos; at = text.find('\n', at + 1)) {
      ++lines;
      lineStart = chunkOffset_ + at + 1;
    }
  }

  void limit() {
    if (chunk_.size() <= sizeLimit_ - chunkOffset_) return;
    tooLarge_ = true;
    chunk_ = chunk_.substr(0, sizeLimit_ - chunkOffset_);
    fd_ = -1;
  }

  void readChunk() {
    countLines(chunk_, linesBefore_, lineStart_);
    chunkOffset_ += chunk_.size();
    position_ = 0;
    ssize_t got = 0;
    do {
      got = ::read(fd_, buffer_.data(), buffer_.size());
    } while (got < 0 && errno == EINTR);
    if (got < 0) readError_ = errno;
    if (got <= 0) fd_ = -1;
    chunk_ = std::string_view(buffer_.data(), got > 0 ? static_cast<std::size_t>(got) : 0);
    limit();
  }

  std::size_t sizeLimit_;
  int fd_ = -1;
  std::vector<char> buffer_;
  std::string_view chunk_;
  std::size_t position_ = 0;
  std::size_t chunkOffset_ = 0;
  std::size_t linesBefore_ = 0;
  std::size_t lineStart_ = 0;
  bool tooLarge_ = false;
  int readError_ = 0;
};

/// Takes the parser's events and builds the dictionary. Answers false, with the reason, for what JSON
/// has and keyed-value text has not.
class Builder : public rapidjson::BaseReaderHandler<rapidjson::UTF8<>, Builder> {
 public:
  bool Null() { return refuse("null is no value here"); }
  bool Bool(bool value) { return place(value) != nullptr; }
  /// The text of a number, as JSON has it. The parser's own conversion is not asked for: it counts the
  /// leading zero bits of a zero, which nobody says what comes of.
  bool RawNumber(const char *text, rapidjson::SizeType length, bool) {
    const std::string number(text, length);
    const char *const end = number.data() + number.size();
    std::int64_t whole = 0;
    const auto read = std::from_chars(number.data(), end, whole);
    if (read.ec == std::errc() && read.ptr == end) return place(whole) != nullptr;
    double real = 0;
    if (std::from_chars(number.data(), end, real).ec == std::errc()) return place(real) != nullptr;
    // Too small to be told from zero, or too large.
    real = std::strtod(number.c_str(), nullptr);
    return std::isfinite(real) ? place(real) != nullptr : refuse("Number too big to be stored in double");
  }
  bool String(const char *text, rapidjson::SizeType length, bool) {
    const std::string_view string(text, length);
    return isWellFormed(string) && place(string);
  }
  bool StartObject() { return start(Dictionary()); }
  bool Key(const char *text, rapidjson::SizeType length, bool) {
    const std::string_view key(text, length);
    if (!isWellFormed(key)) return false;
    Dictionary &dictionary = *open_.back()->dictionary();
    const std::size_t before = dictionary.size();
    slot_ = &dictionary.emplace_hint(dictionary.end(), key, false)->second;
    if (dictionary.size() == before) return refuse("the key " + quotedPath(key) + " stands twice in one object");
    return true;
  }
  bool EndObject(rapidjson::SizeType) { return end(); }
  bool StartArray() { return start(List()); }
  bool EndArray(rapidjson::SizeType) { return end(); }

  [[nodiscard]] const std::string &problem() const { return problem_; }
  Dictionary take() { return std::move(*root_.dictionary()); }

 private:
  bool refuse(std::string problem) {
    problem_ = std::move(problem);
    return false;
  }

  /// The parser has checked the bytes of the text, but not an escape that stands for half a character.
  bool isWellFormed(std::string_view text) {
    for (std::size_t at = text.find('\xED'); at != std::string_view::npos; at = text.find('\xED', at + 1)) {
      if (at + 1 < text.size() && static_cast<unsigned char>(text[at + 1]) >= 0xA0) {
        return refuse("an escape stands for half a character");
      }
    }
    return true;
  }

  /// Puts the value where the text has it; gives its place, good as long as its container is open.
  Value *place(Value value) {
    if (open_.empty()) {
      refuse("the text is not an object");
      return nullptr;
    }
    if (List *list = open_.back()->list()) return &list->emplace_back(std::move(value));
    *slot_ = std::move(value);
    return slot_;
  }

  template <class Container>
  bool start(Container container) {
    if (open_.size() == keyedValueNestingLimit) {
      return refuse("there are more than " + std::to_string(keyedValueNestingLimit) + " levels");
    }
    Value *started = nullptr;
    if (open_.empty() && std::is_same_v<Container, Dictionary>) {
      started = &root_;
    } else {
      started = place(std::move(container));
    }
    if (started) open_.push_back(started);
    return started != nullptr;
  }

  bool end() {
    open_.pop_back();
    return true;
  }

  Value root_ = Dictionary();
  std::vector<Value *> open_;
  Value *slot_ = nullptr;
  std::string problem_;
};

SXError formatError(std::string_view name, const std::string &place, const std::string &problem) {
  return SXError(std::string(filesErrorDomain), keyedValueFormatErrorCode,
                 {{"description", escapedForLog(name) + ": " + place + ": " + problem}});
}

std::string tooLargeProblem(std::size_t sizeLimit) {
  return "the text is longer than " + std::to_string(sizeLimit) + " bytes";
}

/// The parser's words, to stand inside a sentence.
std::string parserProblem(rapidjson::ParseErrorCode code) {
  std::string words = rapidjson::GetParseError_En(code);
  if (words.ends_with('.')) words.pop_back();
  return words;
}

Result<Dictionary> read(TextStream &stream, std::string_view name) {
  Builder builder;
  rapidjson::Reader reader;
  const rapidjson::ParseResult result =
      reader.Parse<rapidjson::kParseValidateEncodingFlag | rapidjson::kParseNumbersAsStringsFlag>(stream, builder);
  if (stream.readError() != 0) return posixError(stream.readError(), "Cannot read " + quotedPath(name));
  if (stream.isTooLarge()) {
    return formatError(name, stream.placeOf(stream.sizeLimit()), tooLargeProblem(stream.sizeLimit()));
  }
  if (result.IsError()) {
    const std::string problem = builder.problem().empty() ? parserProblem(result.Code()) : builder.problem();
    return formatError(name, stream.placeOf(result.Offset()), problem);
  }
  // The parser takes a zero byte for the end.
  if (!stream.atEnd()) return formatError(name, stream.placeOf(stream.Tell()), "a zero byte in the text");
  return builder.take();
}

}  // namespace

Result<Dictionary> readKeyedValues(int fd, std::string_view name, std::size_t sizeLimit) {
  struct stat status {};
  if (::fstat(fd, &status) == 0 && S_ISREG(status.st_mode) && static_cast<std::uint64_t>(status.st_size) > sizeLimit) {
    return formatError(name, "byte " + std::to_string(sizeLimit + 1), tooLargeProblem(sizeLimit));
  }
  TextStream stream(fd, sizeLimit);
  return read(stream, name);
}

Result<Dictionary> parseKeyedValues(std::string_view text, std::string_view name) {
  TextStream stream(text);
  return read(stream, name);
}

Result<Dictionary> readKeyedValueFile(const std::string &path) {
  const UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd) return posixError(errno, "Cannot open " + quotedPath(path));
  struct stat status {};
  if (::fstat(fd.get(), &status) != 0) return posixError(errno, "Cannot look at " + quotedPath(path));
  if (!S_ISREG(status.st_mode)) return posixError(EINVAL, "Not a regular file: " + quotedPath(path));
  return readKeyedValues(fd.get(), path);
}

}  // namespace storix::linuxhost
