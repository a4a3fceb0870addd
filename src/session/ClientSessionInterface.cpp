#include "session/ClientSessionInterface.h"

#include <utility>

#include "platform/Log.h"

namespace telvane {

namespace {

Value optionalList(std::optional<Array> list) { return list ? Value(std::move(*list)) : Value(); }
Value optionalText(std::optional<std::string> text) { return text ? Value(std::move(*text)) : Value(); }

// Wraps the connection's reply function for the session's states reply.
TelvanedSession::StatesReply statesReply(IpcConnection::ReplyHandler reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](std::optional<Array> states, std::optional<Array> whitelist,
                                    std::optional<Array> blacklist) {
    reply(Array{optionalList(std::move(states)), optionalList(std::move(whitelist)),
                optionalList(std::move(blacklist))});
  };
}

TelvanedSession::TextReply textReply(IpcConnection::ReplyHandler reply) {
  if (!reply) return nullptr;
  return [reply = std::move(reply)](std::optional<std::string> text) { reply(Array{optionalText(std::move(text))}); };
}

}  // namespace

Value ClientSessionInterface::errorValue(const std::optional<TelvaneError>& error) {
  if (!error) return Value();
  return Value(Dictionary{{"domain", Value(error->domain)},
                          {"code", Value(static_cast<long long>(error->code))},
                          {"description", Value(error->description)}});
}

void ClientSessionInterface::exportSession(const std::shared_ptr<IpcConnection>& connection,
                                           const std::shared_ptr<TelvanedSession>& session) {
  connection->setCallHandler([weak = std::weak_ptr<TelvanedSession>(session)](IpcConnection::IncomingCall& call) {
    auto session = weak.lock();
    if (!session) return;
    dispatch(*session, call);
  });
}

void ClientSessionInterface::dispatch(TelvanedSession& session, IpcConnection::IncomingCall& call) {
  Array& args = call.arguments;
  switch (call.operation) {
    case ipc::Operation::SetSessionInfo:
      session.setSessionInfo(args[0], args[1], args[2], args[3].boolValue());
      break;
    case ipc::Operation::StartConfig:
      session.startConfigWithCompletionHandler(statesReply(std::move(call.reply)));
      break;
    case ipc::Operation::FetchStates:
      session.fetchStatesWithUserInfo(args[0], statesReply(std::move(call.reply)));
      break;
    case ipc::Operation::FetchDisplayURL:
      session.fetchDisplayURL(textReply(std::move(call.reply)));
      break;
    case ipc::Operation::SendMessageWithDictionary:
      session.sendMessageWithDictionary(args[0], textReply(std::move(call.reply)));
      break;
    case ipc::Operation::FlushMessages: {
      TelvanedSession::FlushReply reply;
      if (call.reply) {
        reply = [reply = std::move(call.reply)](std::optional<std::string> result, std::optional<TelvaneError> error) {
          reply(Array{optionalText(std::move(result)), errorValue(error)});
        };
      }
      session.flushMessagesWithCompletion(std::move(reply));
      break;
    }
    case ipc::Operation::FinishSessionGracefully:
      session.finishSessionGracefully();
      break;
    case ipc::Operation::UploadFileAtPath: {
      FileAccessToken token;
      if (const Bytes* bytes = args[1].asBytes()) token.token = *bytes;
      // The client opened the file; the daemon reads it only through this descriptor,
      // which is closed when the call returns.
      UniqueFd descriptor = call.descriptors.empty() ? UniqueFd() : std::move(call.descriptors.front());
      token.descriptor = descriptor.get();
      TelvanedSession::UploadReply reply;
      if (call.reply) {
        reply = [reply = std::move(call.reply)](bool succeeded, bool removeFile) {
          reply(Array{Value(succeeded), Value(removeFile)});
        };
      }
      session.uploadFileAtPath(args[0].stringOrEmpty(), token, std::move(reply));
      break;
    }
    case ipc::Operation::UploadLogData: {
      TelvanedSession::LogDataReply reply;
      if (call.reply) {
        reply = [reply = std::move(call.reply)](bool succeeded, std::optional<TelvaneError> error) {
          reply(Array{Value(succeeded), errorValue(error)});
        };
      }
      const Array* list = args[0].asArray();
      session.uploadLogData(list ? *list : Array{}, std::move(reply));
      break;
    }
    case ipc::Operation::SendMessageWithSessionInfo:
      session.sendMessageWithSessionInfo(args[0], args[1], args[2].unsignedShortValue(),
                                         args[3].unsignedShortValue(), args[4], textReply(std::move(call.reply)));
      break;
    case ipc::Operation::UpdateSharedDataWithDictionary:
      session.updateSharedDataWithDictionary(args[0]);
      break;
    case ipc::Operation::UpdateSharedDataForKey:
      session.updateSharedDataForKey(args[0].stringOrEmpty(), args[1]);
      break;
    case ipc::Operation::SetDigestKey: {
      const Bytes* key = args[0].asBytes();
      session.setDigestKey(key ? std::optional<Bytes>(*key) : std::nullopt, args[1].intValue());
      break;
    }
    case ipc::Operation::GetPersistentIdentifierForDNU:
      session.persistentIdentifierForDNU(args[0].boolValue(), false, textReply(std::move(call.reply)));
      break;
    case ipc::Operation::RegeneratePersistentIdentifierForDNU:
      session.persistentIdentifierForDNU(args[0].boolValue(), true, textReply(std::move(call.reply)));
      break;
    case ipc::Operation::None:
    case ipc::Operation::SendMessageToClient:
      // The connection refuses these before they get here.
      log::error("ClientSessionInterface: unexpected operation %d for %s", static_cast<int>(call.operation),
                 session.description());
      break;
  }
}

}  // namespace telvane
