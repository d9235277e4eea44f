#include "vitd_helper/service.h"

#include <cstdio>
#include <cstdlib>
#include <memory>

#include "model/log.h"
#include "vitd_helper/message_responder.h"
#include "xpc/listener.h"

namespace vtr {
namespace {

// The process-wide listener: made once, never released while the process lives.
Listener* gListener = nullptr;

// A connection delivers only dictionaries (anything else is a protocol error
// that closes it), so this cannot fail; it stands guard all the same.
void AssertDictionary(const XpcObject& event) {
  if (event.type() == XpcObject::Type::kDictionary) return;
  std::fprintf(stderr,
               "Assertion failed: (type == XPC_TYPE_DICTIONARY), function __VTRH_handle_connection_block_invoke, "
               "file vitd_helper/vitd_helper, line 65.\n");
  std::abort();
}

void HandleConnectionEvent(const std::shared_ptr<Connection>& connection, const ConnectionEvent& event) {
  VTRDebugLog("Checking the type");
  if (event.kind == ConnectionEvent::Kind::kInvalid) {
    VTRDebugLog("It's an XPC_TYPE_ERROR");
    VTRLog("XPC disconnected by client");
    VTRHMessageResponder::sharedInstance().setConnection({});
    return;
  }
  VTRLog("Received an XPC request?");
  AssertDictionary(event.message);
  VTRLog("VTRH: Received a XPC request");
  VTRHMessageResponder::sharedInstance().setConnection(connection);
  VTRHMessageResponder::sharedInstance().handleXPCMessage(event.message);
  VTRLog("Message handled");
}

void HandleListenerEvent(const ListenerEvent& event) {
  switch (event.kind) {
    case ListenerEvent::Kind::kConnection: {
      VTRLog("It's an XPC_TYPE_CONNECTION");
      VTRLog("Start to deal with new connection");
      // The handler holds its connection; the connection drops its handler
      // after its last event, so nothing is kept alive for ever.
      std::shared_ptr<Connection> connection = event.connection;
      connection->setEventHandler(
          [connection](const ConnectionEvent& e) { HandleConnectionEvent(connection, e); });
      return;
    }
    case ListenerEvent::Kind::kTerminationImminent:
      VTRLog("XPC connection will be closed");
      std::exit(0);
    case ListenerEvent::Kind::kConnectionInvalid:
      VTRLog("No XPC connection, exiting");
      std::exit(0);
    case ListenerEvent::Kind::kError:
      VTRLog("Got XPC error on listener connection: %s", event.description);
      gListener->cancel();
      std::exit(1);
  }
}

}  // namespace

int CreateXPCListener(UniqueFd procDirectory) {
  if (gListener != nullptr) return 0;
  ListenerOptions options;
  options.procDirectory = std::make_shared<UniqueFd>(std::move(procDirectory));
  Result<std::unique_ptr<Listener>> listener = Listener::Create(kServiceSocketPath, options);
  if (!listener.ok()) {
    VTRLog("Could not create XPC listener.");
    std::exit(1);
  }
  gListener = listener->release();
  gListener->setEventHandler(HandleListenerEvent);
  return 0;
}

void RunService() {
  gListener->run();
  std::exit(0);  // run() returns only when stopped, which the helper never does
}

}  // namespace vtr
