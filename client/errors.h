#pragma once
// Exceptions of the client library.
//
//   cvdb::Error                 any failure of a client call
//   ├── cvdb::ConnectFailed     the server could not be reached
//   ├── cvdb::Refused           the server does not know the command's tag;
//   │                           the connection goes on
//   └── cvdb::ConnectionEnded   the connection is gone: the server ended it
//       │                       (Bye, with its reason), the socket dropped,
//       │                       an answer did not come in time, or the server
//       │                       sent something this client cannot read
//       └── cvdb::OperationFailed  a backup, restore or cleanup failed; the
//                                  text is the server's failure message

#include <cstdint>
#include <stdexcept>
#include <string>

namespace cvdb {

class Error : public std::runtime_error {
 public:
  using std::runtime_error::runtime_error;
};

class ConnectFailed : public Error {
 public:
  using Error::Error;
};

class Refused : public Error {
 public:
  Refused(std::uint8_t tag, const std::string& text) : Error(text), tag_(tag) {}
  std::uint8_t tag() const noexcept { return tag_; }

 private:
  std::uint8_t tag_;
};

class ConnectionEnded : public Error {
 public:
  // byServer: the server said why (a Bye frame); reason is its text.
  ConnectionEnded(const std::string& reason, bool byServer)
      : Error(byServer ? "the server ended the connection: " + reason : "connection lost: " + reason),
        reason_(reason),
        byServer_(byServer) {}
  const std::string& reason() const noexcept { return reason_; }
  bool byServer() const noexcept { return byServer_; }

 private:
  std::string reason_;
  bool byServer_;
};

class OperationFailed : public ConnectionEnded {
 public:
  explicit OperationFailed(const std::string& failureText) : ConnectionEnded(failureText, true) {}
};

}  // namespace cvdb
