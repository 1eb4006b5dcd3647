#include "QuarterKit/Errors.h"

#include <utility>

namespace quarterkit {

namespace {

const std::pair<uint64_t, const char*> kErrors[] = {
    {1, "success"},
    {4, "could not move the item aside"},
    {5, "could not remove the transient container"},
    {6, "could not create a sub-directory"},
    {7, "could not create the staging directory"},
    {8, "could not move the new container into place"},
    {9, "could not remove the staging directory"},
    {10, "invalid path"},
    {11, "invalid parameter"},
    {12, "could not read the file"},
    {14, "could not move the old container to staging"},
    {15, "replace failed"},
    {17, "could not destroy the item"},
    {18, "no identifier given"},
    {21, "no such container"},
    {22, "old and new are the same container"},
    {23, "containers of different classes"},
    {24, "no such info value"},
    {27, "already exists"},
    {28, "delete failed"},
    {29, "invalid metadata"},
    {33, "invalid replace information"},
    {34, "could not write the file"},
    {35, "replace journal failed"},
    {36, "could not remove the item"},
    {38, "invalid argument"},
    {40, "exception inside the daemon"},
    {41, "could not move to death row"},
    {43, "container cache rebuild failed"},
    {44, "container cache inconsistent"},
    {45, "could not add to the container cache"},
    {46, "could not remove from the container cache"},
    {47, "invalid input to the container cache"},
    {48, "could not move to the new UUID"},
    {49, "invalid request"},
    {55, "not entitled"},
    {56, "containers of different users"},
    {60, "code-signing values and identifiers differ in number"},
    {61, "device locked, change not retried"},
    {62, "could not change the owner"},
    {63, "ACL failed"},
    {64, "could not move the shared content"},
    {66, "code-signing database error"},
    {67, "not in the code-signing database"},
    {68, "unexpected change count in the code-signing database"},
    {69, "superseded by a newer protection change"},
};

}  // namespace

const char* errorText(uint64_t code) {
  for (const auto& [number, text] : kErrors)
    if (number == code) return text;
  return nullptr;
}

std::string describeResult(uint64_t code) {
  if (code == 1) return "ok";
  const char* text = errorText(code);
  std::string out = "error " + std::to_string(code);
  return text ? out + " (" + text + ")" : out;
}

}  // namespace quarterkit
