// Reading a request's common arguments: the container class ("ContainerClass",
// 1-13, else 20), the identifier (18 when missing), the user identity named by
// "PersonaUniqueString" (76 when it is not the client's or names no persona)
// and the container identity built from them. Every failure stores its code
// in the result cell and logs why. Used by the handlers on the listener queue.
#pragma once

#include <optional>
#include <string>

#include "base/VSAError.h"
#include "base/VSAValue.h"
#include "model/VSAConcreteContainerIdentity.h"
#include "model/VSAContainerIdentity.h"

class VSAClientConnection;

struct VSAIdentityKeys {
  const char* identifier = "Identifier";
  const char* containerClass = "ContainerClass";
  const char* uuid = "UUID";
  const char* personaUniqueString = "PersonaUniqueString";
};

class VSARequestArguments {
 public:
  VSARequestArguments(const VSAValue& request, VSAClientConnection& connection,
                      VSAResultCode* result)
      : request_(request), connection_(connection), result_(result) {}

  std::optional<VSAContainerClass> containerClass(const char* key = "ContainerClass");
  const std::string* identifier(const char* key = "Identifier");
  bool boolValue(const char* key, bool fallback = false) const;
  // The user identity that owns containers of `containerClass` for this request.
  VSAUserIdentityRef userIdentity(VSAContainerClass containerClass,
                                  const char* personaKey = "PersonaUniqueString");
  // The identity named by the keys; with a fixed class the class key is not read.
  VSAContainerIdentityRef containerIdentity(const VSAIdentityKeys& keys = {},
                                            std::optional<VSAContainerClass> fixedClass = {});
  VSAConcreteContainerIdentityRef concreteContainerIdentity(const VSAIdentityKeys& keys = {});
  // Concrete when the request carries the UUID key, else plain (the
  // operation then acts on the live container of the identifier).
  VSAContainerIdentityRef namedContainerIdentity(const VSAIdentityKeys& keys = {},
                                                 std::optional<VSAContainerClass> fixedClass = {});
  const VSAValue* value(const char* key) const { return request_.get(key); }

  void fail(VSAResultCode code) { VSASetCode(result_, code); }
  // Refuses (code 11, one rate-limited log line per client) a client string
  // that the daemon could turn into a file name but that is not a safe one.
  bool acceptClientName(const std::string& value, const char* key);

 private:
  const VSAValue& request_;
  VSAClientConnection& connection_;
  VSAResultCode* result_;
};
