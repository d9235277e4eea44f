#include "vitd_helper/service.h"

#include <cstdio>
#include <cstdlib>
#include <memory>
#include <optional>

#include "model/log.h"
#include "vitd_helper/message_responder.h"

namespace vtr {
namespace {

// A connection delivers only dictionaries (anything else is a protocol error
// that closes it), so this cannot fail; it stands guard all the same.
void AssertDictionary(const XpcObject& event) {
  if (event.type() == XpcObject::Type::kDictionary) return;
  std::fprintf(stderr,
               "Assertion failed: (type == XPC_TYPE_DICTIONARY), function __VTRH_handle_connection_block_invoke, "
               "file vitd_helper/vitd_helper, line 65.\n");
  std::abort();
}

// Whom the lines logged for a connection are charged to: a peer without the
// entitlement, by its uid; the entitled client's lines are not limited.
std::optional<uint32_t> LogPeerOf(const Connection& connection) {
  if (connection.trusted()) return std::nullopt;
  return connection.peer().uid();
}

void HandleConnectionEvent(const std::shared_ptr<Connection>& connection, const ConnectionEvent& event) {
  ScopedLogPeer peer(LogPeerOf(*connection));
  VTRDebugLog("Checking the type");
  if (event.kind == ConnectionEvent::Kind::kInvalid) {
    VTRDebugLog("It's an XPC_TYPE_ERROR");
    VTRLog("XPC disconnected by client");
    VTRHMessageResponder::sharedInstance().setConnection({});
    return;
  }
  VTRLog("Received an XPC request?");
  // A dropped frame came from a peer without the entitlement: it was never
  // decoded, and the responder's check says why it gets no reply.
  if (event.kind == ConnectionEvent::Kind::kMessage) AssertDictionary(event.message);
  VTRLog("VTRH: Received a XPC request");
  VTRHMessageResponder::sharedInstance().setConnection(connection);
  VTRHMessageResponder::sharedInstance().handleXPCMessage(event.message);
  VTRLog("Message handled");
}

// Whether a peer's frames are worth decoding: its executable holds the
// entitlement now. The responder checks again for every message.
bool TrustPeer(const PeerIdentity& peer) {
  Result<SecTask> task = SecTask::CreateWithPeer(peer);
  return task.ok() && VTRHMessageResponder::GrantsEntitlement(task->copyValueForEntitlement(kVitrelldEntitlement));
}

}  // namespace

HelperService::HelperService(UniqueFd procDirectory, std::string socketPath)
    : proc_(std::make_shared<const UniqueFd>(std::move(procDirectory))), socketPath_(std::move(socketPath)) {}

int HelperService::createXPCListener() {
  if (listener_) return 0;
  ListenerOptions options;
  options.procDirectory = proc_;
  options.trustPeer = TrustPeer;
  Result<std::unique_ptr<Listener>> listener = Listener::Create(socketPath_, options);
  if (!listener.ok()) {
    VTRLogError("Could not create XPC listener.");
    const Error& why = listener.error();
    const std::string where = socketPath_.empty() ? "the socket systemd passes" : socketPath_;
    if (why.code() == EADDRINUSE) {
      VTRJournalError("Cannot listen: another helper is already listening on %@ (%@)", where, why.description());
    } else {
      VTRJournalError("Cannot listen on %@: %@", where, why.description());
    }
    return 1;
  }
  listener_ = std::move(*listener);
  listener_->setEventHandler([this](const ListenerEvent& event) { handleListenerEvent(event); });
  return 0;
}

int HelperService::run() {
  if (createXPCListener() != 0) return 1;
  listener_->run();
  return exitStatus_;
}

void HelperService::finish(int status) {
  exitStatus_ = status;
  listener_->stop();
}

void HelperService::handleListenerEvent(const ListenerEvent& event) {
  switch (event.kind) {
    case ListenerEvent::Kind::kConnection: {
      ScopedLogPeer peer(LogPeerOf(*event.connection));
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
      return finish(0);
    case ListenerEvent::Kind::kConnectionInvalid:
      VTRLogError("No XPC connection, exiting");
      return finish(0);
    case ListenerEvent::Kind::kError:
      VTRLogError("Got XPC error on listener connection: %s", event.description);
      listener_->cancel();
      return finish(1);
  }
}

}  // namespace vtr
