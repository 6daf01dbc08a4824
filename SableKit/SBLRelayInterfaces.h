#pragma once

#include <cstddef>
#include <cstdint>

#include "platform/Relay.h"

/// The interfaces spoken between the daemon and its clients. The order of methods is part of the
/// contract; the enumerations give each its place.
namespace sable {

/// Exported by the daemon on every client connection.
extern const platform::RelayInterface kSBLDaemonRelay;
struct SBLDaemonRelay {
  enum Method : std::size_t {
    configure,                           ///< a{sv} configuration -> s endpoint address
    bag,                                 ///< -> s raw bag JSON, s user agent, a{sv} error
    request,                             ///< s class, a{sv} record -> t query id, a{sv} reply, a{sv} error
    reportEvent,                         ///< t event, x query id, s class, ay message
    reportEventData,                     ///< t event, x query id, ay payload message
    feedback,                            ///< -> as feedback JSON, a{sv} error
    listenToFlusher,                     ///< -> s endpoint address
    listSessions,                        ///< -> aa{sv}
    fileHandleAndAttributesForResource,  ///< s identifier -> ah file, a{sv} attributes, a{sv} error
  };
};

/// Exported beside it, for those who look into the daemon.
extern const platform::RelayInterface kSBLDiagnosticsRelay;
struct SBLDiagnosticsRelay {
  enum Method : std::size_t {
    explain,    ///< s class, a{sv} record -> s JSON: what the request would do, and why
    resources,  ///< -> s JSON: the resource files, what is held of them and what is planned
    privacy,    ///< -> s JSON: what requests would tell of the device now
  };
};

/// Implemented by clients: the daemon pushes bags.
extern const platform::RelayInterface kSBLClientRelay;
struct SBLClientRelay {
  enum Method : std::size_t {
    bagDidLoad,  ///< s raw bag JSON, s user agent, a{sv} error
  };
};

/// Exported by the daemon on the endpoint that `configure` answers with.
extern const platform::RelayInterface kSBLEndpointRelay;
struct SBLEndpointRelay {
  enum Method : std::size_t {
    request,     ///< s class, a{sv} record, a{sv} configuration -> as SBLDaemonRelay::request
    loadImages,  ///< aa{sv} descriptions, t deadline -> a{say} images
  };
};

/// Exported by the daemon on the endpoint that `listenToFlusher` answers with.
extern const platform::RelayInterface kSBLFlusherListener;
struct SBLFlusherListener {
  enum Method : std::size_t {
    initiateConnectionWithIntent,  ///< t intent, an SBLFlusherIntent
  };
};

/// What a tool asks for; travels as a number: never renumber.
enum class SBLFlusherIntent : std::uint64_t {
  watchSessions = 0,  ///< receive every session's envelope when it is uploaded
  watchFeedback = 1,  ///< receive every feedback when it is added
  stop = 2,           ///< upload nothing from here on
  dump = 3,           ///< end all sessions, upload what there is, and go on uploading
};

/// Implemented by the tool at the other end of that endpoint. It answers each call when it is ready
/// for more.
extern const platform::RelayInterface kSBLFlusherListenerRelay;
struct SBLFlusherListenerRelay {
  enum Method : std::size_t {
    workDone,         ///< what stop or dump asked for is done
    receiveFeedback,  ///< s feedback as JSON
    receiveSessions,  ///< as envelopes as JSON
    dropped,          ///< t records that were left out here, for the tool did not keep up
  };
};

}  // namespace sable
