// fbf-ingest: a reference receiver for feedback uploads, for development,
// tests, the demo and benchmarks.
//
//   fbf-ingest --listen 127.0.0.1:PORT [--tls CERT KEY] [--record FILE]
//              [--status CODE ...] [--delay-ms N] [--drop] [--port-file F]
//
// An HTTP/1.1 server (HTTPS with --tls) on one address. For every request it
// inflates the raw DEFLATE body, checks the "X-Corvane-Digest" header, decodes
// the body by its "type" query item (protobuf session, cohort feedback, JSON),
// answers, and appends one JSON line describing the request to the record
// file (standard output without --record), with one write per line, made
// before the answer is sent:
//
//   {"method","path","query":{name:value|null},"headers":{name:value},
//    "body_size","inflated_size"(null when the body does not inflate),
//    "digest_ok","digest_kind","type","decoded"(JSON or null),
//    "decode_error"(when decoding failed),"status"(answered, or "dropped")}
//
// "decoded" is the proto3 JSON mapping (field names as in the .proto file,
// 64-bit integers and bytes as strings, enums by name, default values left
// out); a map's members come in the order they were sent.
//
// "digest_kind" is "sha512" when the header is the plain SHA-512 of the
// inflated bytes, "passes/<pattern>" when it is the uploader's per-pass
// digest for one of its write patterns ("whole", "1024", "8192"), "missing"
// or "mismatch"; "digest_ok" is true for the first two.
//
// Faults chosen per run: --status answers the codes in order, the last one
// repeating (default 200); --delay-ms waits before answering; --drop closes
// the connection instead of answering. With PORT 0 the bound port is written
// to --port-file (atomically). SIGINT/SIGTERM end the process with status 0.
#pragma once

#include <optional>
#include <string>
#include <utility>
#include <vector>

namespace fbf::ingest {

struct ReceivedRequest {
  std::string method;
  std::string target;  // path and query as sent
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;
};

// Writes the record line of `request` into `line`, up to its "status".
void describeRequest(const ReceivedRequest& request, std::string& line);
// Ends the line with the status answered, or with "dropped", and a newline.
void finishLine(std::string& line, int status);
void finishLineDropped(std::string& line);

// Raw DEFLATE; no value when the data is not one complete stream.
std::optional<std::string> inflateRaw(const std::string& compressed);

int run(int argc, char** argv);

}  // namespace fbf::ingest
