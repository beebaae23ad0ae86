#include <algorithm>

#include "base/VSALog.h"
#include "daemon/VSAClientConnection.h"
#include "daemon/VSACommandHandlers.h"

// The identities a client may use are those its app is associated with: an
// app listed by an enterprise persona runs there, an app listed by a
// universal or system persona runs in every persona, any other app only in
// the personal persona. Identities without a unique string contribute none.
void VSAHandlePersonaUniqueStrings(const VSAValue&, VSAValue& reply,
                                   VSAClientConnection& connection, VSAResultCode*) {
  std::vector<std::string> strings;
  const auto& client = connection.clientIdentity();
  auto& cache = *connection.context().userIdentityCache;
  if (client && cache.personasAreSupported()) {
    for (const auto& identity : cache.userIdentitiesForBundleIdentifier(client->bundleIdentifier()))
      if (identity && identity->personaUniqueString())
        strings.push_back(*identity->personaUniqueString());
  }
  std::sort(strings.begin(), strings.end());
  VSAValue::Array array;
  for (auto& s : strings) array.push_back(VSAValue(std::move(s)));
  reply.set("ReplyPersonaUniqueStringsArray", VSAValue(std::move(array)));
}
