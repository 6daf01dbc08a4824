#include "SableKit/SBLRelayInterfaces.h"

#include <array>

namespace sable {
namespace {

using platform::RelayMethod;

constexpr std::array kDaemonMethods{
    RelayMethod{"Configure", "a{sv}", "s"},
    RelayMethod{"Bag", "", "ssa{sv}"},
    RelayMethod{"Request", "sa{sv}", "ta{sv}a{sv}"},
    RelayMethod{"ReportEvent", "txsay", ""},
    RelayMethod{"ReportEventData", "txay", ""},
    RelayMethod{"Feedback", "", "asa{sv}"},
    RelayMethod{"ListenToFlusher", "", "s"},
    RelayMethod{"ListSessions", "", "aa{sv}"},
    RelayMethod{"FileHandleAndAttributesForResource", "s", "aha{sv}a{sv}"},
};

constexpr std::array kDiagnosticsMethods{
    RelayMethod{"Explain", "sa{sv}", "s"},
    RelayMethod{"Resources", "", "s"},
    RelayMethod{"Privacy", "", "s"},
};

constexpr std::array kClientMethods{
    RelayMethod{"BagDidLoad", "ssa{sv}", ""},
};

constexpr std::array kEndpointMethods{
    RelayMethod{"Request", "sa{sv}a{sv}", "ta{sv}a{sv}"},
    RelayMethod{"LoadImages", "aa{sv}t", "a{say}"},
};

constexpr std::array kFlusherListenerMethods{
    RelayMethod{"InitiateConnectionWithIntent", "t", ""},
};

constexpr std::array kFlusherListenerRelayMethods{
    RelayMethod{"WorkDone", "", ""},
    RelayMethod{"ReceiveFeedback", "s", ""},
    RelayMethod{"ReceiveSessions", "as", ""},
    RelayMethod{"Dropped", "t", ""},
};

}  // namespace

const platform::RelayInterface kSBLDaemonRelay{"com.kestrel.SBLDaemonRelay", "/com/kestrel/sabled",
                                               kDaemonMethods};
const platform::RelayInterface kSBLDiagnosticsRelay{"com.kestrel.SBLDiagnosticsRelay",
                                                    "/com/kestrel/diagnostics", kDiagnosticsMethods};
const platform::RelayInterface kSBLClientRelay{"com.kestrel.SBLClientRelay", "/com/kestrel/client",
                                               kClientMethods};
const platform::RelayInterface kSBLEndpointRelay{"com.kestrel.SBLEndpointRelay", "/com/kestrel/endpoint",
                                                 kEndpointMethods};
const platform::RelayInterface kSBLFlusherListener{"com.kestrel.SBLFlusherListener", "/com/kestrel/flusher",
                                                   kFlusherListenerMethods};
const platform::RelayInterface kSBLFlusherListenerRelay{"com.kestrel.SBLFlusherListenerRelay",
                                                        "/com/kestrel/client", kFlusherListenerRelayMethods};

}  // namespace sable
