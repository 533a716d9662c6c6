#include "Run.h"

#include <string>
#include <vector>

#include "Errors.h"
#include "Io.h"
#include "JsonCodec.h"
#include "JsonText.h"
#include "TavoKarst/KarstLib.h"

namespace karstctl {

using TavoKarst::KarstLib;

namespace {

// Parses the input and decodes it with "decode", naming the source in any
// error so the message points at the file as well as the field.
template <typename Decode>
auto ReadRecords(const std::string& fileOrDash, Decode decode) {
  const std::string source = SourceName(fileOrDash);
  Json document = ParseJsonText(ReadInput(fileOrDash), source);
  try {
    return decode(document);
  } catch (const InputError& e) {
    throw InputError(source + ": " + e.what());
  }
}

void PrintJson(const Json& value) { WriteOutput(DumpJsonText(value)); }

}  // namespace

void RunCommand(const Invocation& invocation) {
  const std::vector<std::string>& operands = invocation.operands;
  switch (invocation.command) {
    case Command::kReset:
      KarstLib::Reset();
      break;
    case Command::kPoliciesSet:
      KarstLib::AddPolicyInfo(ReadRecords(
          operands[0], [](const Json& json) { return PoliciesFromJson(json, "policies"); }));
      break;
    case Command::kPoliciesList:
      PrintJson(PoliciesToJson(KarstLib::ListPolicyInfo()));
      break;
    case Command::kDatastoresSet:
      KarstLib::AddDatastoreInfo(ReadRecords(
          operands[0], [](const Json& json) { return DatastoresFromJson(json, "datastores"); }));
      break;
    case Command::kDatastoresList:
      PrintJson(DatastoresToJson(KarstLib::ListDatastoreInfo()));
      break;
    case Command::kImport: {
      Catalogue catalogue = ReadRecords(operands[0], CatalogueFromJson);
      if (catalogue.policies) KarstLib::AddPolicyInfo(*catalogue.policies);
      if (catalogue.datastores) KarstLib::AddDatastoreInfo(*catalogue.datastores);
      break;
    }
    case Command::kExport: {
      auto policies = KarstLib::ListPolicyInfo();
      auto datastores = KarstLib::ListDatastoreInfo();
      PrintJson(CatalogueToJson(policies, datastores));
      break;
    }
    case Command::kBlobById:
      WriteOutput(KarstLib::GetPolicyBlobById(operands[0], operands[1]));
      break;
    case Command::kBlobCorraById:
      WriteOutput(KarstLib::GetCorraPolicyBlobById(operands[0]));
      break;
    case Command::kBlobCorraByName:
      WriteOutput(KarstLib::GetCorraPolicyBlobByName(operands[0]));
      break;
    case Command::kBlobDefault:
      WriteOutput(KarstLib::GetDefaultPolicyBlob(operands[0]));
      break;
    case Command::kHash: {
      auto hash = KarstLib::GetDbHash();
      Json out = Json::object();
      out["policies"] = hash.first;
      out["datastores"] = hash.second;
      PrintJson(out);
      break;
    }
    case Command::kHelp:
    case Command::kVersion:
      break;  // answered before the store is chosen
  }
}

}  // namespace karstctl
