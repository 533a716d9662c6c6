// What the reliability tests share beyond tests/support: self-describing
// catalogues a reader can tell whole from torn, what a new process finds in
// the store, random bytes and the one-line figures. It also brings in what
// every test of the suite uses.

#ifndef KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_
#define KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_

#include <grp.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <sched.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <map>
#include <random>
#include <string>
#include <thread>
#include <vector>

#include "Child.h"
#include "FaultSweep.h"
#include "FaultVfs.h"
#include "Files.h"
#include "RawSqlite.h"
#include "Records.h"
#include "TavoConfigStore/ConfigStoreException.h"

namespace karst_reliability {

using namespace karst_test;  // NOLINT: the suite's own helpers
using TavoConfigStore::ConfigStoreException;
using TavoKarst::KarstDatastoreInfo;
using TavoKarst::KarstLib;
using TavoKarst::KarstPolicyInfo;

// "full" in a normal build, "reduced" under the sanitizers.
int Scaled(int full, int reduced);

// Names one list a writer replaced a collection with: its writer, its round
// and its length (0: 1..11 policies or 1..7 datastores, from the round).
struct Tag {
  int writer = 0;
  long long round = 0;
  int count = 0;
};

// Every record carries the tag's text and its index, NUL and 0xFF sit in
// the blobs, and policy names repeat between tags, so a replace overwrites
// keys as well as adding and dropping some. Every datastore's namespace and
// default policy exist in every policy list. Lists of more than 100 policies
// carry 1200 more bytes a policy.
std::vector<KarstPolicyInfo> PoliciesFor(Tag tag);
std::vector<KarstDatastoreInfo> DatastoresFor(Tag tag);

// "" for an empty list, the tag's text ("w=1 r=5 n=11") for a list equal to
// that tag's list byte for byte, anything else "torn".
std::string Classify(const std::vector<KarstPolicyInfo>& policies);
std::string Classify(const std::vector<KarstDatastoreInfo>& datastores);

// Both collections as "<policies> | <datastores>", each as Classify gives it:
// of a catalogue, of the lists of two tags, or as a new process with a new
// connection lists them (or how that process failed).
std::string State(const Catalogue& catalogue);
std::string State(Tag policies, Tag datastores);
std::string ReadInFreshProcess();

// "n" random bytes.
std::string RandomBytes(std::size_t n, std::mt19937_64& rng);

// Prints the line "format" makes and keeps it as this run's figures of
// "part"; scripts/test prints them all at the end.
void ReportFigures(const char* part, const char* format, ...) __attribute__((format(printf, 2, 3)));

}  // namespace karst_reliability

#endif  // KARST_TESTS_RELIABILITY_RELIABILITY_UTIL_H_
