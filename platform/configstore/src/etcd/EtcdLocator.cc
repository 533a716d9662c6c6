// Reading "etcd://" locators into EtcdStoreOptions.

#include <cstdlib>
#include <string>
#include <string_view>

#include "TavoConfigStore/EtcdStore.h"

namespace TavoConfigStore {
namespace {

[[noreturn]] void Refuse(const std::string& what) {
  throw ConfigStoreException("etcd locator: " + what, kErrorBadLocator);
}

int HexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// %XX escapes, so a password or file name can hold '@', '/', '&' or ','.
// "what" names the part in the error and never its content.
std::string Unescape(std::string_view text, const char* what) {
  std::string out;
  out.reserve(text.size());
  for (std::size_t i = 0; i < text.size(); ++i) {
    if (text[i] != '%') {
      out += text[i];
      continue;
    }
    const int high = i + 2 < text.size() ? HexDigit(text[i + 1]) : -1;
    const int low = high < 0 ? -1 : HexDigit(text[i + 2]);
    if (low < 0) Refuse(std::string("bad %-escape in the ") + what);
    out += static_cast<char>(high * 16 + low);
    i += 2;
  }
  return out;
}

std::string Env(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? std::string() : std::string(value);
}

void CheckEndpoint(const std::string& endpoint) {
  std::size_t colon = endpoint.rfind(':');
  const bool bracketed = !endpoint.empty() && endpoint[0] == '[';
  if (bracketed && (colon == std::string::npos || colon == 0 || endpoint[colon - 1] != ']')) {
    colon = std::string::npos;
  }
  if (colon == std::string::npos || colon == 0 || (bracketed && colon < 3)) {
    Refuse("endpoint \"" + endpoint + "\" is not HOST:PORT");
  }
  // "fe80::1:2379" would otherwise quietly become host "fe80::1", port 2379.
  if (!bracketed && endpoint.find(':') != colon) {
    Refuse("endpoint \"" + endpoint + "\" is not HOST:PORT (an IPv6 address goes in [brackets])");
  }
  const std::string port = endpoint.substr(colon + 1);
  if (port.empty() || port.size() > 5 ||
      port.find_first_not_of("0123456789") != std::string::npos || std::stoi(port) < 1 ||
      std::stoi(port) > 65535) {
    Refuse("endpoint \"" + endpoint + "\" has no port from 1 to 65535");
  }
}

// "USER[:PASSWORD]", %-escaped in a locator but taken literally from the
// environment, as etcdctl takes it.
void SetUser(EtcdStoreOptions& options, std::string_view userInfo, bool escaped) {
  auto take = [escaped](std::string_view text, const char* what) {
    return escaped ? Unescape(text, what) : std::string(text);
  };
  const std::size_t colon = userInfo.find(':');
  options.user = take(userInfo.substr(0, colon), "user name");
  if (colon != std::string_view::npos) {
    options.password = take(userInfo.substr(colon + 1), "password");
  }
  if (options.user.empty()) Refuse("empty user name");
}

void SetQuery(EtcdStoreOptions& options, std::string_view query) {
  while (!query.empty()) {
    const std::size_t amp = query.find('&');
    const std::string_view pair = query.substr(0, amp);
    query = amp == std::string_view::npos ? std::string_view() : query.substr(amp + 1);
    const std::size_t eq = pair.find('=');
    const std::string name(pair.substr(0, eq));
    const std::string value =
        eq == std::string_view::npos ? std::string() : Unescape(pair.substr(eq + 1), name.c_str());
    if (value.empty()) Refuse("option \"" + name + "\" needs a value");
    if (name == "cacert") {
      options.caFile = value;
    } else if (name == "cert") {
      options.certFile = value;
    } else if (name == "key") {
      options.keyFile = value;
    } else if (name == "timeout") {
      if (value.size() > 7 || value.find_first_not_of("0123456789") != std::string::npos ||
          std::stoi(value) == 0) {
        Refuse("timeout must be a number of milliseconds from 1 to 9999999");
      }
      options.timeoutMs = std::stoi(value);
    } else if (name == "cache") {
      if (value.size() > 6 || value.find_first_not_of("0123456789") != std::string::npos) {
        Refuse("cache must be a number of MiB from 0 (none) to 999999");
      }
      options.cacheMiB = std::stoi(value);
    } else {
      Refuse("unknown option \"" + name + "\" (known: cacert, cert, key, timeout, cache)");
    }
  }
}

}  // namespace

bool IsEtcdLocator(const std::string& locator) {
  return locator.rfind("etcd://", 0) == 0 || locator.rfind("etcds://", 0) == 0;
}

EtcdStoreOptions ParseEtcdLocator(const std::string& locator) {
  if (!IsEtcdLocator(locator)) Refuse("does not start with etcd:// or etcds://");
  EtcdStoreOptions options;
  options.tls = locator.rfind("etcds://", 0) == 0;
  std::string_view rest(locator);
  rest.remove_prefix(options.tls ? 8 : 7);

  const std::size_t slash = rest.find('/');
  if (slash == std::string_view::npos) Refuse("no /PREFIX after the endpoints");
  std::string_view authority = rest.substr(0, slash);
  std::string_view path = rest.substr(slash + 1);
  // Most likely a password with a bare '/': what came before it would be
  // read, and echoed in errors, as endpoints, and the rest land in the prefix.
  if (path.find('@') != std::string_view::npos) {
    Refuse("'@' after the endpoints: write it as %40, and a '/' in a user name or password as %2F");
  }
  std::string_view query;
  if (const std::size_t mark = path.find('?'); mark != std::string_view::npos) {
    query = path.substr(mark + 1);
    path = path.substr(0, mark);
  }

  if (const std::size_t at = authority.rfind('@'); at != std::string_view::npos) {
    SetUser(options, authority.substr(0, at), true);
    authority = authority.substr(at + 1);
  }
  while (true) {
    const std::size_t comma = authority.find(',');
    options.endpoints.emplace_back(authority.substr(0, comma));
    CheckEndpoint(options.endpoints.back());
    if (comma == std::string_view::npos) break;
    authority = authority.substr(comma + 1);
  }

  while (!path.empty() && path.back() == '/') path.remove_suffix(1);
  options.prefix = Unescape(path, "prefix");
  if (options.prefix.empty()) Refuse("empty PREFIX: name the catalogue's key prefix after the /");
  SetQuery(options, query);

  // etcdctl's variables fill in what the locator leaves out.
  if (options.user.empty() && !Env("ETCDCTL_USER").empty()) {
    SetUser(options, Env("ETCDCTL_USER"), false);
  }
  if (!options.user.empty() && options.password.empty()) options.password = Env("ETCDCTL_PASSWORD");
  if (options.tls) {
    if (options.caFile.empty()) options.caFile = Env("ETCDCTL_CACERT");
    if (options.certFile.empty()) options.certFile = Env("ETCDCTL_CERT");
    if (options.keyFile.empty()) options.keyFile = Env("ETCDCTL_KEY");
  } else if (!options.caFile.empty() || !options.certFile.empty() || !options.keyFile.empty()) {
    Refuse("cacert, cert and key need TLS: use etcds://");
  }
  if (options.certFile.empty() != options.keyFile.empty()) {
    Refuse("a client certificate needs its key and a key its certificate (cert and key)");
  }
  return options;
}

}  // namespace TavoConfigStore
