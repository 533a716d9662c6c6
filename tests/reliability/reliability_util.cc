#include "reliability_util.h"

#include <cstdarg>
#include <cstdio>
#include <iostream>

namespace karst_reliability {

int Scaled(int full, int reduced) { return KARST_RELIABILITY_SANITIZED ? reduced : full; }

static std::string TagText(Tag tag) {
  return "w=" + std::to_string(tag.writer) + " r=" + std::to_string(tag.round) +
         " n=" + std::to_string(tag.count);
}

// The length is checked before the list is built again, so a garbled count
// never builds a huge list.
template <typename Record, typename Make>
static std::string ClassifyList(const std::vector<Record>& list, const std::string& text,
                                Make make) {
  Tag t;
  if (list.empty()) return "";
  const bool tagged =
      std::sscanf(text.c_str(), "w=%d r=%lld n=%d", &t.writer, &t.round, &t.count) == 3;
  return tagged && t.count > 0 && std::size_t(t.count) == list.size() && list == make(t)
             ? TagText(t)
             : "torn";
}

std::vector<KarstPolicyInfo> PoliciesFor(Tag tag) {
  if (tag.count == 0) tag.count = 1 + static_cast<int>((tag.round * 7 + tag.writer * 3) % 11);
  const std::string filler(tag.count > 100 ? 1200 : 0, 'x');
  std::vector<KarstPolicyInfo> out;
  for (int i = 0; i < tag.count; ++i) {
    const std::string text = TagText(tag) + " i=" + std::to_string(i);
    out.push_back(Policy("policy-" + std::to_string(i), "id-" + std::to_string(i % 3),
                         {{std::string("corra\0", 6) + text + "\xff", "CORRA"},
                          {"blob\xfe" + text + filler, "ns-" + std::to_string(i % 2)}},
                         text, tag.round));
  }
  return out;
}

std::vector<KarstDatastoreInfo> DatastoresFor(Tag tag) {
  if (tag.count == 0) tag.count = 1 + static_cast<int>((tag.round * 5 + tag.writer) % 7);
  std::vector<KarstDatastoreInfo> out;
  for (int i = 0; i < tag.count; ++i) {
    out.push_back(Datastore(TagText(tag) + " ds-" + std::to_string(i),
                            "ns-" + std::to_string(i % 2), "id-" + std::to_string(i % 3)));
  }
  return out;
}

std::string Classify(const std::vector<KarstPolicyInfo>& policies) {
  return ClassifyList(policies, policies.empty() ? "" : policies.front().description, PoliciesFor);
}

std::string Classify(const std::vector<KarstDatastoreInfo>& datastores) {
  return ClassifyList(datastores, datastores.empty() ? "" : datastores.front().url, DatastoresFor);
}

std::string State(const Catalogue& catalogue) {
  return Classify(catalogue.policies) + " | " + Classify(catalogue.datastores);
}

std::string State(Tag policies, Tag datastores) {
  return State({PoliciesFor(policies), DatastoresFor(datastores)});
}

std::string ReadInFreshProcess() {
  const ChildResult r = RunChild([](int fd) {
    TavoConfigStore::SetGlobalStore(nullptr);  // the default store, on a new connection
    WriteAll(fd, State(ListCatalogue()));
  });
  return r.Ok() ? r.output : "reading failed: " + r.Describe();
}

std::string RandomBytes(std::size_t n, std::mt19937_64& rng) {
  std::string s(n, '\0');
  for (char& c : s) c = static_cast<char>(rng());
  return s;
}

void ReportFigures(const char* part, const char* format, ...) {
  char line[2048];
  va_list args;
  va_start(args, format);
  std::vsnprintf(line, sizeof line, format, args);
  va_end(args);
  std::cout << line << std::endl;
  std::filesystem::create_directories(KARST_RELIABILITY_FIGURES_DIR);
  std::ofstream(std::string(KARST_RELIABILITY_FIGURES_DIR) + "/" + part + ".txt") << line << "\n";
}

}  // namespace karst_reliability
