// The named IPC service of the agent: a listener per service name, one connection per
// client, and the exported interface and object through which a connection's requests reach
// the agent. A listener asks its delegate about each new connection on the listener's own
// queue; a connection delivers its requests one at a time on its own serial queue, and a
// reply may be given from any thread.
#pragma once

#include <sys/types.h>
#include <functional>
#include <memory>
#include <optional>
#include <string>

#include "core/Value.h"

namespace qax {

class ClientConnection;
class ServiceListener;

// Anything a connection can export. The interface description that serves it casts it to the
// protocol it describes.
class ExportedObject {
  public:
    virtual ~ExportedObject() = default;
};

// The outcome of one request: a value, none (no value and no error), or an error text meant
// for the client (unknown operation, arguments of the wrong kind or count).
struct RemoteReply {
    std::optional<Value> value;
    std::optional<std::string> error;

    static RemoteReply none() { return {}; }
    static RemoteReply of(Value v) { return {std::move(v), std::nullopt}; }
    static RemoteReply failure(std::string text) { return {std::nullopt, std::move(text)}; }
};

// Called exactly once per request, from any thread.
using RemoteReplyHandler = std::function<void(RemoteReply)>;

// The description of an exported protocol: which operations exist and how a request's
// arguments are checked, converted and handed to the exported object. Stateless and shared by
// every connection that exports it.
class RemoteInterface {
  public:
    virtual ~RemoteInterface() = default;
    // Runs `op` on `object` with `args`. Replies an error for an unknown operation or for
    // arguments of the wrong kind or count.
    virtual void invoke(const std::shared_ptr<ExportedObject>& object, const std::string& op,
                        const Value::Array& args, RemoteReplyHandler reply) const = 0;
};

// One accepted client. Until resume() nothing is read from it.
class ClientConnection {
  public:
    virtual ~ClientConnection() = default;
    // The client's process id, as taken when the connection was accepted.
    virtual pid_t peerProcessIdentifier() const = 0;
    // The value of the named entitlement of the client's executable; none when it has none.
    virtual std::optional<Value> entitlementValue(const std::string& name) const = 0;
    virtual void exportInterface(std::shared_ptr<const RemoteInterface> interface) = 0;
    // The connection keeps the object for as long as it is open.
    virtual void exportObject(std::shared_ptr<ExportedObject> object) = 0;
    // Starts delivering the client's requests.
    virtual void resume() = 0;
};

class ServiceListenerDelegate {
  public:
    virtual ~ServiceListenerDelegate() = default;
    // True keeps the connection (the delegate has exported an object and resumed it); false
    // has it closed.
    virtual bool shouldAcceptNewConnection(ServiceListener& listener,
                                           const std::shared_ptr<ClientConnection>& connection) = 0;
};

class ServiceListener {
  public:
    virtual ~ServiceListener() = default;
    // The listener keeps the delegate.
    virtual void setDelegate(std::shared_ptr<ServiceListenerDelegate> delegate) = 0;
    // Starts accepting clients; false when the service could not be published.
    virtual bool resume() = 0;
    // Stops accepting, closes every connection and withdraws the service name.
    virtual void invalidate() = 0;
};

class ServiceListenerFactory {
  public:
    virtual ~ServiceListenerFactory() = default;
    virtual std::shared_ptr<ServiceListener> makeListener(const std::string& serviceName) = 0;
};

}  // namespace qax
