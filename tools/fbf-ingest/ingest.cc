#include "ingest.h"

#include "upload/compressed_output_stream.h"

#include "corevireon.pb.h"

#include <asio.hpp>
#include <asio/ssl.hpp>
#include <google/protobuf/arena.h>
#include <google/protobuf/descriptor.h>
#include <google/protobuf/message.h>
#include <openssl/evp.h>
#include <strings.h>
#include <zlib.h>

#include <fcntl.h>
#include <malloc.h>
#include <unistd.h>

#include <atomic>
#include <charconv>
#include <cmath>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <mutex>
#include <thread>

namespace fbf::ingest {
namespace {

using asio::awaitable;
using asio::use_awaitable;
using asio::ip::tcp;

constexpr size_t kMaxHeaderBytes = 64 * 1024;
constexpr size_t kMaxBodyBytes = 256 * 1024 * 1024;
constexpr size_t kArenaBlockBytes = 512 * 1024;

bool iequals(std::string_view a, std::string_view b) {
  return a.size() == b.size() && strncasecmp(a.data(), b.data(), a.size()) == 0;
}

std::optional<std::string> headerValue(const ReceivedRequest& r, std::string_view name) {
  for (const auto& [k, v] : r.headers) {
    if (iequals(k, name)) return v;
  }
  return std::nullopt;
}

std::string hex(const unsigned char* p, size_t n) {
  static constexpr char kHex[] = "0123456789abcdef";
  std::string out;
  for (size_t i = 0; i < n; ++i) {
    out.push_back(kHex[p[i] >> 4]);
    out.push_back(kHex[p[i] & 0xf]);
  }
  return out;
}

// The digest the uploader's stream computes when `data` is written in
// pieces of `chunk` bytes (0: one write).
std::string perPassDigest(const std::string& data, size_t chunk) {
  CompressedOutputStream stream;
  stream.open();
  auto* p = reinterpret_cast<const uint8_t*>(data.data());
  if (chunk == 0) {
    stream.write(p, data.size());
  } else {
    for (size_t off = 0; off < data.size(); off += chunk) stream.write(p + off, std::min(chunk, data.size() - off));
  }
  stream.close();
  return stream.dataDigestForStream();
}

// The kind of digest `header` is for `inflated`, which arrived as `bodySize`
// compressed bytes. A one-write payload's digest is the SHA-512 of its bytes
// repeated once per compression pass, and every pass but the last fills the
// 4096-byte staging buffer, so there are at most bodySize / 4096 + 1 passes:
// hashing the payload again and again and comparing after each repetition
// recognises the plain digest (one pass) and every one-write digest at the
// cost of the hashing the sender did, without compressing anything. Only a
// digest that matches none of those is checked against the other write
// patterns by compressing the payload as the sender would have.
std::string digestKind(const std::string& header, const std::string& inflated, size_t bodySize) {
  const std::string& wanted = header;
  if (wanted.size() != 128) return "mismatch";
  size_t maxPasses = bodySize / CompressedOutputStream::kStagingBufferSize + 2;
  EVP_MD_CTX* ctx = EVP_MD_CTX_new();
  EVP_MD_CTX* probe = EVP_MD_CTX_new();
  EVP_DigestInit_ex(ctx, EVP_sha512(), nullptr);
  std::string kind;
  for (size_t passes = 1; passes <= maxPasses && kind.empty(); ++passes) {
    EVP_DigestUpdate(ctx, inflated.data(), inflated.size());
    EVP_MD_CTX_copy_ex(probe, ctx);
    unsigned char md[64];
    unsigned int len = 0;
    EVP_DigestFinal_ex(probe, md, &len);
    if (hex(md, len) == wanted) kind = passes == 1 ? "sha512" : "passes/whole";
    // An empty payload hashes the same however often it is repeated.
    if (inflated.empty()) break;
  }
  EVP_MD_CTX_free(probe);
  EVP_MD_CTX_free(ctx);
  if (!kind.empty()) return kind;
  for (auto [chunk, name] : {std::pair<size_t, const char*>{1024, "passes/1024"}, {8192, "passes/8192"}}) {
    if (wanted == perPassDigest(inflated, chunk)) return name;
  }
  return "mismatch";
}

int hexValue(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

std::string percentDecode(std::string_view s) {
  std::string out;
  for (size_t i = 0; i < s.size(); ++i) {
    if (s[i] == '%' && i + 2 < s.size() && hexValue(s[i + 1]) >= 0 && hexValue(s[i + 2]) >= 0) {
      out.push_back(static_cast<char>(hexValue(s[i + 1]) * 16 + hexValue(s[i + 2])));
      i += 2;
    } else {
      out.push_back(s[i]);
    }
  }
  return out;
}

// Compact JSON of a message in the proto3 JSON mapping (field names as in
// the .proto file, 64-bit integers and bytes as strings, enums by name,
// fields that are unset or at their default left out), written straight
// into the record line through reflection. The library's converter goes
// through a generic object stream and formats every number twice over; for
// sessions it was most of this receiver's work. The messages here use no
// well-known types, which would need their own mapping.
class JsonPrinter {
 public:
  explicit JsonPrinter(std::string& out) : out_(out) {}

  void message(const google::protobuf::Message& m) {
    const auto* reflection = m.GetReflection();
    std::vector<const google::protobuf::FieldDescriptor*> fields;
    reflection->ListFields(m, &fields);
    out_ += '{';
    bool first = true;
    for (const auto* field : fields) {
      if (!first) out_ += ',';
      first = false;
      string(field->name());
      out_ += ':';
      if (field->is_map()) {
        map(m, field);
      } else if (field->is_repeated()) {
        out_ += '[';
        int n = reflection->FieldSize(m, field);
        for (int i = 0; i < n; ++i) {
          if (i > 0) out_ += ',';
          value(m, field, i);
        }
        out_ += ']';
      } else {
        value(m, field, -1);
      }
    }
    out_ += '}';
  }

 private:
  void map(const google::protobuf::Message& m, const google::protobuf::FieldDescriptor* field) {
    const auto* reflection = m.GetReflection();
    const auto* keyField = field->message_type()->map_key();
    const auto* valueField = field->message_type()->map_value();
    out_ += '{';
    int n = reflection->FieldSize(m, field);
    for (int i = 0; i < n; ++i) {
      if (i > 0) out_ += ',';
      const auto& entry = reflection->GetRepeatedMessage(m, field, i);
      std::string key;
      std::string saved;
      saved.swap(out_);
      value(entry, keyField, -1);
      key.swap(out_);
      out_.swap(saved);
      if (key.empty() || key.front() != '"') {
        string(key);  // numbers and booleans are quoted as keys
      } else {
        out_ += key;
      }
      out_ += ':';
      value(entry, valueField, -1);
    }
    out_ += '}';
  }

  void number(double v) {
    if (std::isnan(v)) {
      out_ += "\"NaN\"";
    } else if (std::isinf(v)) {
      out_ += v > 0 ? "\"Infinity\"" : "\"-Infinity\"";
    } else {
      char buf[32];
      auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
      out_.append(buf, ec == std::errc() ? end : buf);
    }
  }

  template <typename T>
  void integer(T v, bool quoted) {
    char buf[24];
    auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
    if (quoted) out_ += '"';
    out_.append(buf, end);
    if (quoted) out_ += '"';
  }

  void value(const google::protobuf::Message& m, const google::protobuf::FieldDescriptor* f, int i) {
    using FD = google::protobuf::FieldDescriptor;
    const auto* r = m.GetReflection();
    const bool rep = i >= 0;
    switch (f->cpp_type()) {
      case FD::CPPTYPE_INT32: integer(rep ? r->GetRepeatedInt32(m, f, i) : r->GetInt32(m, f), false); break;
      case FD::CPPTYPE_UINT32: integer(rep ? r->GetRepeatedUInt32(m, f, i) : r->GetUInt32(m, f), false); break;
      case FD::CPPTYPE_INT64: integer(rep ? r->GetRepeatedInt64(m, f, i) : r->GetInt64(m, f), true); break;
      case FD::CPPTYPE_UINT64: integer(rep ? r->GetRepeatedUInt64(m, f, i) : r->GetUInt64(m, f), true); break;
      case FD::CPPTYPE_DOUBLE: number(rep ? r->GetRepeatedDouble(m, f, i) : r->GetDouble(m, f)); break;
      case FD::CPPTYPE_FLOAT: {
        float v = rep ? r->GetRepeatedFloat(m, f, i) : r->GetFloat(m, f);
        if (std::isfinite(v)) {
          char buf[32];
          auto [end, ec] = std::to_chars(buf, buf + sizeof buf, v);
          out_.append(buf, ec == std::errc() ? end : buf);
        } else {
          number(v);
        }
        break;
      }
      case FD::CPPTYPE_BOOL: out_ += (rep ? r->GetRepeatedBool(m, f, i) : r->GetBool(m, f)) ? "true" : "false"; break;
      case FD::CPPTYPE_ENUM: {
        int v = rep ? r->GetRepeatedEnumValue(m, f, i) : r->GetEnumValue(m, f);
        if (const auto* e = f->enum_type()->FindValueByNumber(v)) {
          string(e->name());
        } else {
          integer(v, false);
        }
        break;
      }
      case FD::CPPTYPE_STRING: {
        std::string scratch;
        const std::string& v = rep ? r->GetRepeatedStringReference(m, f, i, &scratch) : r->GetStringReference(m, f, &scratch);
        if (f->type() == FD::TYPE_BYTES) {
          base64(v);
        } else {
          string(v);
        }
        break;
      }
      case FD::CPPTYPE_MESSAGE: message(rep ? r->GetRepeatedMessage(m, f, i) : r->GetMessage(m, f)); break;
    }
  }

  void base64(const std::string& v) {
    std::string encoded(4 * ((v.size() + 2) / 3), '\0');
    int n = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(encoded.data()),
                            reinterpret_cast<const unsigned char*>(v.data()), static_cast<int>(v.size()));
    encoded.resize(static_cast<size_t>(std::max(n, 0)));
    out_ += '"';
    out_ += encoded;
    out_ += '"';
  }

  void string(std::string_view v) {
    static constexpr char kHex[] = "0123456789abcdef";
    out_ += '"';
    // Runs of characters that need no escape are copied whole.
    size_t start = 0;
    for (size_t k = 0; k < v.size(); ++k) {
      auto u = static_cast<unsigned char>(v[k]);
      if (u >= 0x20 && u != '"' && u != '\\') continue;
      out_.append(v.data() + start, k - start);
      start = k + 1;
      switch (u) {
        case '"': out_ += "\\\""; break;
        case '\\': out_ += "\\\\"; break;
        case '\n': out_ += "\\n"; break;
        case '\r': out_ += "\\r"; break;
        case '\t': out_ += "\\t"; break;
        case '\b': out_ += "\\b"; break;
        case '\f': out_ += "\\f"; break;
        default:
          out_ += "\\u00";
          out_ += kHex[u >> 4];
          out_ += kHex[u & 0xf];
      }
    }
    out_.append(v.data() + start, v.size() - start);
    out_ += '"';
  }

  std::string& out_;
};

std::optional<std::string> protobufToJSON(const google::protobuf::Message& m, std::string&) {
  std::string text;
  JsonPrinter(text).message(m);
  return text;
}

// A JSON body as one line of record: validated without building it, then
// copied with its line breaks made spaces (valid JSON has raw line breaks
// only between tokens, where any white space will do).
std::optional<std::string> jsonBodyAsLine(const std::string& body) {
  if (!nlohmann::json::accept(body)) return std::nullopt;
  std::string out = body;
  for (char& c : out) {
    if (c == '\n' || c == '\r') c = ' ';
  }
  return out;
}

}  // namespace

std::optional<std::string> inflateRaw(const std::string& compressed) {
  z_stream z{};
  if (inflateInit2(&z, -15) != Z_OK) return std::nullopt;
  // Inflated into a scratch buffer kept per thread, so that a request costs
  // neither the clearing of a fresh buffer nor its page faults.
  thread_local std::unique_ptr<char[]> scratch;
  thread_local size_t scratchSize = 0;
  size_t produced = 0;
  z.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  z.avail_in = static_cast<uInt>(compressed.size());
  int rc = Z_OK;
  while (rc == Z_OK) {
    if (produced == scratchSize) {
      size_t size = std::max<size_t>({scratchSize * 2, compressed.size() * 4, 256 * 1024});
      auto grown = std::make_unique_for_overwrite<char[]>(size);
      if (produced > 0) std::memcpy(grown.get(), scratch.get(), produced);
      scratch = std::move(grown);
      scratchSize = size;
    }
    size_t room = std::min<size_t>(scratchSize - produced, 1u << 30);
    z.next_out = reinterpret_cast<Bytef*>(scratch.get() + produced);
    z.avail_out = static_cast<uInt>(room);
    rc = inflate(&z, Z_NO_FLUSH);
    produced += room - z.avail_out;
    if (rc == Z_BUF_ERROR) {
      if (z.avail_in == 0 || z.avail_out != 0) break;
      rc = Z_OK;  // only out of room: grow and go on
    }
  }
  bool complete = rc == Z_STREAM_END && z.avail_in == 0;
  inflateEnd(&z);
  if (!complete) return std::nullopt;
  return std::string(scratch.get(), produced);
}

RequestDescription describeRequest(const ReceivedRequest& request) {
  RequestDescription out;
  nlohmann::ordered_json& line = out.head;
  line["method"] = request.method;
  std::string_view target = request.target;
  auto q = target.find('?');
  line["path"] = std::string(target.substr(0, q));
  nlohmann::ordered_json query = nlohmann::ordered_json::object();
  std::string type;
  if (q != std::string_view::npos) {
    std::string_view rest = target.substr(q + 1);
    while (!rest.empty()) {
      auto amp = rest.find('&');
      auto piece = rest.substr(0, amp);
      rest = amp == std::string_view::npos ? std::string_view() : rest.substr(amp + 1);
      if (piece.empty()) continue;
      auto eq = piece.find('=');
      auto name = percentDecode(piece.substr(0, eq));
      if (eq == std::string_view::npos) {
        query[name] = nullptr;
      } else {
        query[name] = percentDecode(piece.substr(eq + 1));
        if (name == "type") type = query[name].get<std::string>();
      }
    }
  }
  line["query"] = query;
  nlohmann::ordered_json headers = nlohmann::ordered_json::object();
  for (const auto& [k, v] : request.headers) headers[k] = v;
  line["headers"] = headers;
  line["body_size"] = request.body.size();

  auto inflated = inflateRaw(request.body);
  line["inflated_size"] = inflated ? nlohmann::ordered_json(inflated->size()) : nlohmann::ordered_json(nullptr);

  std::string kind = "missing";
  if (auto digest = headerValue(request, "X-Corvane-Digest"); digest && inflated) {
    kind = digestKind(*digest, *inflated, request.body.size());
  } else if (digest) {
    kind = "mismatch";
  }
  line["digest_ok"] = kind != "missing" && kind != "mismatch";
  line["digest_kind"] = kind;
  line["type"] = type;

  std::optional<std::string> decoded;
  std::string& error = out.decodeError;
  // Decoded messages live in an arena over a block kept per thread: a
  // session is thousands of small messages, each otherwise its own
  // allocation.
  thread_local std::unique_ptr<char[]> arenaBlock = std::make_unique_for_overwrite<char[]>(kArenaBlockBytes);
  google::protobuf::ArenaOptions arenaOptions;
  arenaOptions.initial_block = arenaBlock.get();
  arenaOptions.initial_block_size = kArenaBlockBytes;
  google::protobuf::Arena arena(arenaOptions);
  if (!inflated) {
    error = "the body is not a raw DEFLATE stream";
  } else if (type == "FeedbackV2PB") {
    auto* session = google::protobuf::Arena::CreateMessage<corevireon::CVClientSession>(&arena);
    if (session->ParseFromString(*inflated)) {
      decoded = protobufToJSON(*session, error);
    } else {
      error = "not a CVClientSession";
    }
  } else if (iequals(type, "Usage")) {
    auto* feedback = google::protobuf::Arena::CreateMessage<corevireon::CVCohortsFeedback>(&arena);
    if (feedback->ParseFromString(*inflated)) {
      decoded = protobufToJSON(*feedback, error);
    } else {
      error = "not a CVCohortsFeedback";
    }
  } else if (auto ct = headerValue(request, "Content-Type"); ct && iequals(*ct, "application/protobuf")) {
    // Protobuf of a type this receiver has no message for: recorded by size only.
    error = "no message known for type " + type;
  } else {
    decoded = jsonBodyAsLine(*inflated);
    if (!decoded) error = "not JSON";
  }
  out.decoded = decoded ? std::move(*decoded) : "null";
  return out;
}

std::string RequestDescription::line(const nlohmann::ordered_json& status) const {
  constexpr auto kReplace = nlohmann::ordered_json::error_handler_t::replace;
  std::string text = head.dump(-1, ' ', false, kReplace);
  text.pop_back();  // the closing brace: the rest follows
  text.reserve(text.size() + decoded.size() + decodeError.size() + 64);
  text += ",\"decoded\":";
  text += decoded;
  if (!decodeError.empty()) {
    text += ",\"decode_error\":";
    text += nlohmann::ordered_json(decodeError).dump(-1, ' ', false, kReplace);
  }
  text += ",\"status\":";
  text += status.dump();
  text += "}\n";
  return text;
}

namespace {

struct Options {
  std::string host = "127.0.0.1";
  unsigned short port = 0;
  std::optional<std::pair<std::string, std::string>> tls;
  std::optional<std::string> record;
  std::vector<int> statuses;
  int delayMs = 0;
  bool drop = false;
  std::optional<std::string> portFile;
};

int usage(const std::string& why) {
  std::cerr << "fbf-ingest: " << why << "\n"
            << "usage: fbf-ingest --listen HOST:PORT [--tls CERT KEY] [--record FILE] [--status CODE ...]\n"
            << "                  [--delay-ms N] [--drop] [--port-file FILE]\n";
  return 2;
}

std::optional<int> parseInt(const std::string& s) {
  try {
    size_t pos = 0;
    int v = std::stoi(s, &pos);
    if (pos != s.size()) return std::nullopt;
    return v;
  } catch (...) {
    return std::nullopt;
  }
}

const char* reason(int code) {
  switch (code) {
    case 200: return "OK";
    case 201: return "Created";
    case 204: return "No Content";
    case 400: return "Bad Request";
    case 404: return "Not Found";
    case 500: return "Internal Server Error";
    case 503: return "Service Unavailable";
    default: return "Status";
  }
}

// Connections are served concurrently, on as many threads as there are
// cores; the record and the answer counter are the only shared state.
class Server {
 public:
  explicit Server(Options options) : options_(std::move(options)) {
    if (options_.record) {
      recordFd_ = ::open(options_.record->c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
      if (recordFd_ < 0) throw std::runtime_error("cannot open the record file " + *options_.record);
    }
  }
  ~Server() {
    if (recordFd_ != STDOUT_FILENO) ::close(recordFd_);
  }
  Server(const Server&) = delete;
  Server& operator=(const Server&) = delete;

  const Options& options() const { return options_; }

  int nextStatus() {
    if (options_.statuses.empty()) return 200;
    size_t i = std::min(answered_.fetch_add(1), options_.statuses.size() - 1);
    return options_.statuses[i];
  }

  // One write per line, done before the request is answered, so that a
  // client that has its answer finds the line in the record. The lock keeps
  // lines whole when they go to a pipe.
  void record(const std::string& line) {
    std::lock_guard lock(recordLock_);
    size_t done = 0;
    while (done < line.size()) {
      ssize_t n = ::write(recordFd_, line.data() + done, line.size() - done);
      if (n < 0 && errno == EINTR) continue;
      if (n <= 0) {
        std::cerr << "fbf-ingest: cannot write the record: " << std::strerror(errno) << std::endl;
        return;
      }
      done += static_cast<size_t>(n);
    }
  }

  template <typename Stream>
  awaitable<void> serve(Stream& stream, tcp::socket& socket) {
    std::string buffer;
    while (true) {
      size_t headerEnd = co_await asio::async_read_until(stream, asio::dynamic_buffer(buffer, kMaxHeaderBytes),
                                                         "\r\n\r\n", use_awaitable);
      ReceivedRequest request;
      std::string head = buffer.substr(0, headerEnd);
      buffer.erase(0, headerEnd);
      if (!parseHead(head, request)) co_return;

      if (auto expect = headerValue(request, "Expect"); expect && iequals(*expect, "100-continue")) {
        static const std::string kContinue = "HTTP/1.1 100 Continue\r\n\r\n";
        co_await asio::async_write(stream, asio::buffer(kContinue), use_awaitable);
      }
      auto te = headerValue(request, "Transfer-Encoding");
      if (te && iequals(*te, "chunked")) {
        co_await readChunked(stream, buffer, request.body);
      } else {
        size_t length = 0;
        if (auto cl = headerValue(request, "Content-Length")) length = std::stoull(*cl);
        if (length > kMaxBodyBytes) co_return;
        if (buffer.size() < length) {
          co_await asio::async_read(stream, asio::dynamic_buffer(buffer), asio::transfer_exactly(length - buffer.size()),
                                    use_awaitable);
        }
        request.body = buffer.substr(0, length);
        buffer.erase(0, length);
      }

      auto description = describeRequest(request);
      if (options_.delayMs > 0) {
        asio::steady_timer timer(socket.get_executor(), std::chrono::milliseconds(options_.delayMs));
        co_await timer.async_wait(use_awaitable);
      }
      if (options_.drop) {
        record(description.line("dropped"));
        std::error_code ec;
        socket.shutdown(tcp::socket::shutdown_both, ec);
        socket.close(ec);
        co_return;
      }
      int status = nextStatus();
      record(description.line(status));
      bool close = false;
      if (auto c = headerValue(request, "Connection"); c && iequals(*c, "close")) close = true;
      std::string response = "HTTP/1.1 " + std::to_string(status) + " " + reason(status) + "\r\n";
      if (status != 204) response += "Content-Length: 0\r\n";
      response += close ? "Connection: close\r\n\r\n" : "\r\n";
      co_await asio::async_write(stream, asio::buffer(response), use_awaitable);
      if (close) co_return;
    }
  }

 private:
  static bool parseHead(const std::string& head, ReceivedRequest& r) {
    std::string_view rest = head;
    auto eol = rest.find("\r\n");
    std::string_view first = rest.substr(0, eol);
    rest = rest.substr(eol + 2);
    auto sp1 = first.find(' ');
    auto sp2 = first.rfind(' ');
    if (sp1 == std::string_view::npos || sp2 == sp1) return false;
    r.method = std::string(first.substr(0, sp1));
    r.target = std::string(first.substr(sp1 + 1, sp2 - sp1 - 1));
    while (!rest.empty()) {
      eol = rest.find("\r\n");
      std::string_view line = rest.substr(0, eol);
      rest = eol == std::string_view::npos ? std::string_view() : rest.substr(eol + 2);
      if (line.empty()) break;
      auto colon = line.find(':');
      if (colon == std::string_view::npos) return false;
      auto value = line.substr(colon + 1);
      while (!value.empty() && (value.front() == ' ' || value.front() == '\t')) value.remove_prefix(1);
      while (!value.empty() && (value.back() == ' ' || value.back() == '\t')) value.remove_suffix(1);
      r.headers.emplace_back(std::string(line.substr(0, colon)), std::string(value));
    }
    return true;
  }

  template <typename Stream>
  awaitable<void> readLine(Stream& stream, std::string& buffer, std::string& line) {
    size_t n = co_await asio::async_read_until(stream, asio::dynamic_buffer(buffer, kMaxBodyBytes), "\r\n",
                                               use_awaitable);
    line = buffer.substr(0, n - 2);
    buffer.erase(0, n);
  }

  template <typename Stream>
  awaitable<void> readChunked(Stream& stream, std::string& buffer, std::string& body) {
    std::string line;
    while (true) {
      co_await readLine(stream, buffer, line);
      size_t size = std::stoull(line.substr(0, line.find(';')), nullptr, 16);
      if (size == 0) break;
      if (body.size() + size > kMaxBodyBytes) throw std::runtime_error("body too large");
      if (buffer.size() < size + 2) {
        co_await asio::async_read(stream, asio::dynamic_buffer(buffer), asio::transfer_exactly(size + 2 - buffer.size()),
                                  use_awaitable);
      }
      body.append(buffer, 0, size);
      buffer.erase(0, size + 2);
    }
    do {  // trailers, up to the empty line
      co_await readLine(stream, buffer, line);
    } while (!line.empty());
  }

  Options options_;
  int recordFd_ = STDOUT_FILENO;
  std::mutex recordLock_;
  std::atomic<size_t> answered_{0};
};

awaitable<void> handlePlain(Server& server, tcp::socket socket) {
  try {
    co_await server.serve(socket, socket);
  } catch (const std::exception&) {
    // The peer went away or sent something unreadable; the connection ends.
  }
}

awaitable<void> handleTLS(Server& server, asio::ssl::context& context, tcp::socket socket) {
  asio::ssl::stream<tcp::socket> stream(std::move(socket), context);
  try {
    co_await stream.async_handshake(asio::ssl::stream_base::server, use_awaitable);
    co_await server.serve(stream, stream.next_layer());
  } catch (const std::exception&) {
    // Failed handshakes (a client refusing our key) end here.
  }
}

awaitable<void> acceptLoop(Server& server, tcp::acceptor& acceptor, asio::ssl::context* tls) {
  while (true) {
    tcp::socket socket = co_await acceptor.async_accept(use_awaitable);
    std::error_code ignored;
    socket.set_option(tcp::no_delay(true), ignored);  // answers are small and must not wait
    if (tls) {
      asio::co_spawn(acceptor.get_executor(), handleTLS(server, *tls, std::move(socket)), asio::detached);
    } else {
      asio::co_spawn(acceptor.get_executor(), handlePlain(server, std::move(socket)), asio::detached);
    }
  }
}

}  // namespace

int run(int argc, char** argv) {
  Options options;
  bool haveListen = false;
  std::vector<std::string> args(argv + 1, argv + argc);
  for (size_t i = 0; i < args.size(); ++i) {
    const auto& a = args[i];
    auto needs = [&](size_t n) { return i + n < args.size(); };
    if (a == "--listen" && needs(1)) {
      auto spec = args[++i];
      auto colon = spec.rfind(':');
      auto port = colon == std::string::npos ? std::nullopt : parseInt(spec.substr(colon + 1));
      if (!port || *port < 0 || *port > 65535) return usage("--listen needs HOST:PORT");
      options.host = spec.substr(0, colon);
      options.port = static_cast<unsigned short>(*port);
      haveListen = true;
    } else if (a == "--tls" && needs(2)) {
      options.tls = std::make_pair(args[i + 1], args[i + 2]);
      i += 2;
    } else if (a == "--record" && needs(1)) {
      options.record = args[++i];
    } else if (a == "--status") {
      while (i + 1 < args.size() && !args[i + 1].starts_with("--")) {
        auto code = parseInt(args[++i]);
        if (!code || *code < 100 || *code > 999) return usage("bad status code " + args[i]);
        options.statuses.push_back(*code);
      }
      if (options.statuses.empty()) return usage("--status needs at least one code");
    } else if (a == "--delay-ms" && needs(1)) {
      auto ms = parseInt(args[++i]);
      if (!ms || *ms < 0) return usage("bad --delay-ms");
      options.delayMs = *ms;
    } else if (a == "--drop") {
      options.drop = true;
    } else if (a == "--port-file" && needs(1)) {
      options.portFile = args[++i];
    } else if (a == "--help" || a == "-h") {
      usage("a reference receiver for feedback uploads");
      return 0;
    } else {
      return usage("unknown or incomplete argument " + a);
    }
  }
  if (!haveListen) return usage("--listen is required");
  // Request buffers of a few hundred kilobytes come and go all the time:
  // keep them in the heap instead of mapping and unmapping them each time.
  mallopt(M_MMAP_THRESHOLD, 64 * 1024 * 1024);
  mallopt(M_TRIM_THRESHOLD, 256 * 1024 * 1024);

  try {
    unsigned threads = std::max(1u, std::thread::hardware_concurrency());
    asio::io_context io(static_cast<int>(threads));
    std::unique_ptr<asio::ssl::context> tls;
    if (options.tls) {
      tls = std::make_unique<asio::ssl::context>(asio::ssl::context::tls_server);
      tls->set_options(asio::ssl::context::default_workarounds | asio::ssl::context::no_sslv2 |
                       asio::ssl::context::no_sslv3);
      tls->use_certificate_chain_file(options.tls->first);
      tls->use_private_key_file(options.tls->second, asio::ssl::context::pem);
    }
    tcp::endpoint endpoint(asio::ip::make_address(options.host), options.port);
    tcp::acceptor acceptor(io, endpoint);
    unsigned short port = acceptor.local_endpoint().port();
    if (options.portFile) {
      std::string tmp = *options.portFile + ".tmp";
      {
        std::ofstream out(tmp, std::ios::trunc);
        out << port << "\n";
      }
      std::filesystem::rename(tmp, *options.portFile);
    }
    std::cerr << "fbf-ingest: listening on " << options.host << ":" << port << (tls ? " (https)" : " (http)")
              << std::endl;
    Server server(options);
    asio::signal_set signals(io, SIGINT, SIGTERM);
    signals.async_wait([&](const std::error_code&, int) { io.stop(); });
    asio::co_spawn(io, acceptLoop(server, acceptor, tls.get()), asio::detached);
    std::vector<std::thread> helpers;
    for (unsigned i = 1; i < threads; ++i) helpers.emplace_back([&io] { io.run(); });
    io.run();
    for (auto& t : helpers) t.join();
  } catch (const std::exception& e) {
    std::cerr << "fbf-ingest: " << e.what() << std::endl;
    return 1;
  }
  return 0;
}

}  // namespace fbf::ingest
