// The registry of backends: which backend a store locator names, and how to
// open it. The table below is the one place that knows the backends.

#include <strings.h>

#include <string>
#include <string_view>

#include "TavoConfigStore/ConfigStore.h"
#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {
namespace {

bool IsAsciiLetter(char c) { return (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z'); }

bool IsSchemeCharacter(char c) {
  return IsAsciiLetter(c) || (c >= '0' && c <= '9') || c == '+' || c == '-' || c == '.';
}

// A URL's scheme and the slash after it: a letter, then letters, digits,
// '+', '-' or '.', then ":/" ("http:/", "ETCD://", "etcdx://").
bool StartsWithScheme(std::string_view text) {
  if (text.empty() || !IsAsciiLetter(text[0])) return false;
  std::size_t end = 1;
  while (end < text.size() && IsSchemeCharacter(text[end])) ++end;
  return text.substr(end, 2) == ":/";
}

// "etcd" or "etcds" in any case, then ':' or "//": an etcd locator with a
// slash or the colon missing ("etcd:host:2379/p", "etcd//host:2379/p").
bool StartsLikeEtcd(const std::string& text) {
  for (const std::string_view scheme : {"etcds", "etcd"}) {
    if (strncasecmp(text.c_str(), scheme.data(), scheme.size()) != 0) continue;
    if (text.compare(scheme.size(), 1, ":") == 0 || text.compare(scheme.size(), 2, "//") == 0) {
      return true;
    }
  }
  return false;
}

// Taken as a path, a mistyped etcd locator would become a store file under a
// folder named after the cluster, its password included, and the catalogue
// would never reach the cluster: whatever looks like a URL is no path.
bool IsPath(const std::string& locator) {
  return !StartsWithScheme(locator) && !StartsLikeEtcd(locator);
}

struct LocatorEntry {
  LocatorKind kind;
  bool (*names)(const std::string& locator);
  std::shared_ptr<ConfigStore> (*open)(const std::string& locator);
};

const LocatorEntry kLocators[] = {
    {LocatorKind::kEtcd, IsEtcdLocator,
     [](const std::string& locator) { return NewEtcdStore(ParseEtcdLocator(locator)); }},
    {LocatorKind::kPath, IsPath,
     [](const std::string& locator) { return NewSqliteStore(locator); }},
};

const LocatorEntry& EntryOf(const std::string& locator) {
  for (const LocatorEntry& entry : kLocators) {
    if (entry.names(locator)) return entry;
  }
  throw ConfigStoreException("store locator \"" + RedactLocator(locator) +
                                 "\" looks like a URL but is no etcd:// or etcds:// locator; "
                                 "put ./ in front to make it a file path",
                             kErrorBadLocator);
}

}  // namespace

LocatorKind KindOfLocator(const std::string& locator) { return EntryOf(locator).kind; }

std::shared_ptr<ConfigStore> OpenStore(const std::string& locator) {
  return EntryOf(locator).open(locator);
}

// The password runs from the colon after the user name to the last '@': a
// password may hold '@', '/' or ':' of its own when it is not %-escaped.
// Without a scheme, whatever comes before the first colon is taken for the
// user name, so at worst more is hidden than the password.
std::string RedactLocator(const std::string& locator) {
  const std::size_t at = locator.rfind('@');
  if (at == std::string::npos) return locator;
  std::size_t colon = locator.find(':');
  if (StartsWithScheme(locator)) colon = locator.find(':', colon + 1);
  if (colon == std::string::npos || colon > at) return locator;
  return locator.substr(0, colon + 1) + "***" + locator.substr(at);
}

}  // namespace TavoConfigStore
