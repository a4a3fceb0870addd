// ClientSessionInterface: the operations a client calls on its session over IPC.
//
// `exportSession` makes the session the connection's exported object: each incoming
// call (whose argument types the connection has already checked against the
// operation table) is converted and handed to the matching session operation, and the
// session's reply is converted back: lists or nil for the state queries, an error as
// the map {"domain", "code", "description"} or nil. An upload carries one file
// descriptor, which is passed to the backends for the duration of the call and closed
// afterwards.
//
// The connection holds the session weakly: the agent's registry owns it.
//
// Threading: calls arrive and run on the connection's queue, which is the session's
// queue.
#pragma once

#include <memory>

#include "platform/IpcConnection.h"
#include "session/TelvanedSession.h"
#include "telvane/Value.h"
#include "util/TelvaneError.h"

namespace telvane {

class ClientSessionInterface {
 public:
  // Installs the dispatcher as the connection's call handler. Call before resume().
  static void exportSession(const std::shared_ptr<IpcConnection>& connection,
                            const std::shared_ptr<TelvanedSession>& session);

  // Runs one incoming call on the session.
  static void dispatch(TelvanedSession& session, IpcConnection::IncomingCall& call);

  // The wire form of an error: {"domain", "code", "description"}, or nil.
  static Value errorValue(const std::optional<TelvaneError>& error);
};

}  // namespace telvane
