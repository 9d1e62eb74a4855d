// The daemon's IPC listening socket: a Unix stream socket at
// $XDG_RUNTIME_DIR/vireon-fbf.sock, owner-only, or the socket inherited from
// systemd socket activation.
#pragma once

#include <asio.hpp>

#include <filesystem>
#include <optional>

namespace fbf {

using UnixAcceptor = asio::local::stream_protocol::acceptor;

// The inherited socket when started by socket activation, else a new socket
// bound at `path` (a stale socket file is replaced; anything else at the path
// is an error). No value, after one error line, on failure.
std::optional<UnixAcceptor> openListenerSocket(asio::io_context& io, const std::filesystem::path& path);

}  // namespace fbf
