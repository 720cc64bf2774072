// The default endpoint of a node: an ipc:// path in a directory only this
// user may enter.
#include <TarnMessaging/Remote/Node.h>

#include "RemoteContract.h"

#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <stdexcept>

namespace Tarn::Remote {
namespace {

bool IsValidName(const std::string& inName) {
  if (inName.empty()) return false;
  for (const char c : inName) {
    const bool plain = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') || c == '-' ||
                       c == '_' || c == '.';
    if (!plain) return false;
  }
  return inName != "." && inName != "..";
}

// Makes inDirectory if missing, then checks that it is a directory (not a
// link to one) of this user with no access for anybody else: a directory
// another user made first, to read or take over our sockets, is refused.
void RequirePrivateDirectory(const std::string& inDirectory) {
  if (::mkdir(inDirectory.c_str(), 0700) != 0 && errno != EEXIST) {
    throw std::runtime_error("Tarn::Remote: cannot make " + inDirectory + ": " + std::strerror(errno));
  }
  struct stat status {};
  if (::lstat(inDirectory.c_str(), &status) != 0) {
    throw std::runtime_error("Tarn::Remote: cannot inspect " + inDirectory + ": " + std::strerror(errno));
  }
  if (!S_ISDIR(status.st_mode) || status.st_uid != ::geteuid() || (status.st_mode & 077) != 0) {
    throw std::runtime_error("Tarn::Remote: " + inDirectory +
                             " is not a directory of this user closed to others (mode 0700): refused");
  }
}

}  // namespace


std::string Node::DefaultEndpoint(const std::string& inName) {
  TARN_REMOTE_CONTRACT_CHECK(IsValidName(inName), "Tarn::Remote::Node::DefaultEndpoint");
  if (!IsValidName(inName)) throw std::invalid_argument("Tarn::Remote: not a node name: \"" + inName + "\"");
  const char* runtime = std::getenv("XDG_RUNTIME_DIR");
  const std::string directory = runtime != nullptr && runtime[0] == '/'
                                    ? std::string(runtime) + "/tarn-remote"
                                    : "/tmp/tarn-remote-" + std::to_string(::geteuid());
  RequirePrivateDirectory(directory);
  const std::string path = directory + "/" + inName;
  if (path.size() >= sizeof(sockaddr_un::sun_path)) {
    throw std::runtime_error("Tarn::Remote: the socket path " + path + " is too long");
  }
  return "ipc://" + path;
}

}  // namespace Tarn::Remote
