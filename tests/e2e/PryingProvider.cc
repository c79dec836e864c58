// A provider that is after files which are not its own, as the file "script" in its bundle tells, one line
// a step:
//
//   read PATH      open the file for reading when the process starts; say "read PATH: " and what came of it
//   write PATH     the same for writing
//   connect PATH   the same for a socket
//   answer PATH    say of every item that it lies there
//   link PATH      put a symbolic link to the path in the place of every document

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>

#include "storix/ProviderExtension.h"
#include "wire/UniqueFd.h"

namespace {

using storix::URL;

bool couldOpen(const std::string &path, int flags) {
  const storix::UniqueFd fd(::open(path.c_str(), flags | O_CLOEXEC));
  return static_cast<bool>(fd);
}

bool couldConnect(const std::string &path) {
  sockaddr_un address{AF_UNIX, {}};
  path.copy(address.sun_path, sizeof(address.sun_path) - 1);
  const storix::UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  return ::connect(fd.get(), reinterpret_cast<const sockaddr *>(&address), sizeof(address)) == 0;
}

class PryingProvider : public storix::ProviderExtension {
 public:
  explicit PryingProvider(const storix::ProviderEnvironment &given) : ProviderExtension(given) {
    std::ifstream script(given.bundlePath + "/script");
    std::string verb;
    std::string path;
    while (script >> verb >> std::ws && std::getline(script, path)) {
      if (verb == "answer") answered_ = path;
      if (verb == "link") linked_ = path;
      if (verb == "read") tell(verb, path, couldOpen(path, O_RDONLY));
      if (verb == "write") tell(verb, path, couldOpen(path, O_WRONLY));
      if (verb == "connect") tell(verb, path, couldConnect(path));
    }
  }

  void itemURL(const std::string &identifier, URLCompletion completion) override {
    if (answered_.empty()) return ProviderExtension::itemURL(identifier, std::move(completion));
    completion(*URL::fileURLWithPath(answered_));
  }

  void startProviding(const URL &url, Completion completion) override {
    if (!linked_.empty()) std::filesystem::create_symlink(linked_, url.path());
    completion(std::nullopt);
  }

 private:
  static void tell(const std::string &verb, const std::string &path, bool done) {
    std::fprintf(stderr, "%s %s: %s\n", verb.c_str(), path.c_str(), done ? "done" : std::strerror(errno));
  }

  std::string answered_;
  std::string linked_;
};

}  // namespace

int main() { return storix::runProviderExtension<PryingProvider>(); }
