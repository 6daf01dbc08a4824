#pragma once

#include <sys/types.h>

#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Function.h"
#include "platform/RelayValue.h"
#include "platform/Runtime.h"

/// Inter-process calls between two peers over one connection, either of which may call the other.
///
///     client                                daemon
///     Relay::connect(address) ----------->  RelayListener accept handler: exportObject, resume
///     connection.call(method) ----------->  handler(RelayCall)          on the connection's queue
///     reply handler           <-----------  call.reply(arguments)       from any thread
///     handler(RelayCall)      <-----------  connection.send(method)
///     invalidate() or exit    ----------->  invalidation handler        once, the last thing heard
///
/// A peer that sends what is no valid call gets an error reply where the protocol has one, else
/// loses its connection. A peer that holds too much (calls in flight, unread replies, descriptors)
/// loses its connection too, with one log line. Neither costs anybody else anything. Files go from
/// the listener's side to the client; a client that sends one loses its connection.
namespace sable::platform {

struct RelayMethod {
  std::string_view name;
  std::string_view in;   ///< D-Bus signature of the arguments
  std::string_view out;  ///< D-Bus signature of the reply
};

/// An interface is a constant that outlives every connection.
struct RelayInterface {
  std::string_view name;  ///< "com.kestrel.SBLDaemonRelay"
  std::string_view path;  ///< "/com/kestrel/sabled"
  std::span<const RelayMethod> methods;
};

/// Answers one call, once. Dropped unanswered it answers with an error, so that a caller never
/// waits for a call that was lost; deliberate silence is said with forget(). Any thread; never
/// blocks. Answering a connection that is gone does nothing.
class RelayReply {
 public:
  class Implementation {
   public:
    virtual ~Implementation() = default;
    virtual void send(RelayArguments arguments) = 0;
    virtual void fail(std::string_view name, std::string_view message) = 0;
    virtual void forget() = 0;
  };

  RelayReply() = default;
  explicit RelayReply(std::unique_ptr<Implementation> implementation);
  RelayReply(RelayReply&&) noexcept = default;
  RelayReply& operator=(RelayReply&&) noexcept;
  ~RelayReply();

  /// The arguments must have the method's `out` signature; anything else is a programming error.
  void send(RelayArguments arguments);
  template <class... Values>
  void operator()(Values&&... values) {
    RelayArguments arguments;
    arguments.reserve(sizeof...(values));
    (arguments.emplace_back(std::forward<Values>(values)), ...);
    send(std::move(arguments));
  }
  /// Answers with a D-Bus error ("org.freedesktop.DBus.Error.InvalidArgs").
  void fail(std::string_view name, std::string_view message);
  /// Never answers; the caller's call simply does not complete.
  void forget();

 private:
  std::unique_ptr<Implementation> implementation_;
};

struct RelayCall {
  std::size_t method;        ///< index in the interface's methods
  RelayArguments arguments;  ///< checked against the method's `in` signature
  RelayReply reply;
};

struct RelayPeer {
  pid_t pid = 0;
  uid_t uid = 0;
};

class RelayConnection {
 public:
  virtual ~RelayConnection() = default;

  using CallHandler = Function<void(RelayCall)>;

  /// Calls for `interface` reach `handler` on queue(), one at a time. Before resume().
  virtual void exportObject(const RelayInterface& interface, CallHandler handler) = 0;
  /// Called once on queue() when the connection has ended, however it ended. Before resume().
  virtual void setInvalidationHandler(Function<void()> handler) = 0;
  /// Begins to deliver. Calls that came before wait in the socket.
  virtual void resume() = 0;
  /// Ends the connection: nothing is delivered or sent afterwards. Any thread; idempotent.
  virtual void invalidate() = 0;

  /// Calls the peer without waiting for an answer (one way). Any thread, never blocks.
  virtual void send(const RelayInterface& interface, std::size_t method, RelayArguments arguments) = 0;

  using ReplyHandler = Function<void(Expected<RelayArguments>)>;
  /// Calls the peer; the answer, or the error of a broken connection or passed time-out, reaches
  /// `handler` once on queue(). Any thread, never blocks.
  virtual void call(const RelayInterface& interface, std::size_t method, RelayArguments arguments,
                    Duration timeout, ReplyHandler handler) = 0;

  /// Who is at the other end, as the kernel knew at connect.
  virtual RelayPeer peer() const = 0;
  /// The serial queue of the connection's handlers.
  virtual SerialQueue& queue() = 0;
};

/// An address that a peer can connect to ("unix:path=..."), D-Bus's server address format.
using RelayEndpoint = std::string;

class RelayListener {
 public:
  virtual ~RelayListener() = default;
  /// Decides on each new connection, on a queue of the listener's own; false refuses it. The
  /// handler keeps the connection alive by holding it.
  using AcceptHandler = Function<bool(std::shared_ptr<RelayConnection>)>;
  virtual void setAcceptHandler(AcceptHandler handler) = 0;
  virtual Expected<void> resume() = 0;
  virtual RelayEndpoint endpoint() const = 0;
};

/// Errors of calls: a D-Bus error name is the reason's first word.
inline constexpr std::string_view kRelayErrorDomain = "RelayErrorDomain";
enum class RelayErrorCode { disconnected = 1, timedOut = 2, remoteError = 3, badReply = 4 };

class Relay {
 public:
  virtual ~Relay() = default;

  /// The listener that clients find by name: opened at resume(), which fails when another process
  /// holds it.
  virtual std::unique_ptr<RelayListener> namedListener(std::string_view name) = 0;
  /// A listener reachable only through its endpoint.
  virtual std::unique_ptr<RelayListener> anonymousListener() = 0;

  /// Connects to a listener; not yet resumed. May block for as long as the connect takes.
  virtual Expected<std::shared_ptr<RelayConnection>> connect(const RelayEndpoint& endpoint) = 0;

  /// Path of the executable of a process.
  virtual Expected<std::string> executablePath(pid_t pid) = 0;

  /// Events that may have launched the daemon ("com.kestrel.notifyd.matching"): `handler` gets the
  /// event's name (nullopt when it has none) on `queue`, for the life of the process.
  virtual void setEventStreamHandler(std::string_view stream, std::shared_ptr<SerialQueue> queue,
                                     std::function<void(std::optional<std::string>)> handler) = 0;
};

}  // namespace sable::platform
