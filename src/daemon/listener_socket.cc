#include "daemon/listener_socket.h"

#include "platform/logging.h"

#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

namespace fbf {

std::optional<UnixAcceptor> openListenerSocket(asio::io_context& io, const std::filesystem::path& path) {
  auto& log = logging::get("main");
  int n = sd_listen_fds(1);
  if (n >= 1 && sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) > 0) {
    log.debug("Using the socket handed over by the service manager");
    return UnixAcceptor(io, asio::local::stream_protocol(), SD_LISTEN_FDS_START);
  }

  std::error_code ec;
  auto dir = path.parent_path();
  std::filesystem::create_directories(dir, ec);
  struct stat st {};
  if (lstat(dir.c_str(), &st) != 0 || !S_ISDIR(st.st_mode) || st.st_uid != geteuid()) {
    log.error("Runtime directory {} is missing or not ours; not listening", dir.string());
    return std::nullopt;
  }
  if ((st.st_mode & 0077) != 0) chmod(dir.c_str(), 0700);

  if (lstat(path.c_str(), &st) == 0) {
    if (!S_ISSOCK(st.st_mode)) {
      log.error("{} exists and is not a socket; not listening", path.string());
      return std::nullopt;
    }
    unlink(path.c_str());
  }

  UnixAcceptor acceptor(io);
  // Bind with a restrictive umask so the socket is never briefly world-usable.
  mode_t old = umask(0177);
  acceptor.open(asio::local::stream_protocol(), ec);
  if (!ec) acceptor.bind(asio::local::stream_protocol::endpoint(path.string()), ec);
  umask(old);
  if (!ec) acceptor.listen(asio::socket_base::max_listen_connections, ec);
  if (ec) {
    log.error("Cannot listen on {}: {}", path.string(), ec.message());
    return std::nullopt;
  }
  chmod(path.c_str(), 0600);
  return acceptor;
}

}  // namespace fbf
