#include "platform/TerminationAssertion.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <map>
#include <mutex>
#include <system_error>
#include <thread>

#include "platform/DeviceProperties.h"
#include "platform/DeviceRoot.h"
#include "platform/FileIO.h"
#include "platform/Log.h"
#include "platform/SafePath.h"

namespace platform {

namespace {

// Two holders of one identifier share its file: it goes when the last one
// lets go.
std::mutex gHoldersLock;
std::map<std::string, int>& holders() {
  static auto* counts = new std::map<std::string, int>();
  return *counts;
}

bool usableName(const std::string& identifier) {
  return !identifier.empty() && identifier != "." && identifier != ".." && identifier.find('/') == std::string::npos &&
         identifier.find('\0') == std::string::npos && identifier.size() < 256;
}

int openDirectory(UniqueFd* fd) {
  return safeMakeDirectory(terminationAssertionDirectory(), 0755, true, kAnyOwner, fd);
}

}  // namespace

struct TerminationAssertion::State {
  std::string identifier;
  uint8_t reason = 0;
  bool held = false;         // under gHoldersLock
  bool invalidated = false;  // under gHoldersLock: given up before it was granted
};

std::string terminationAssertionDirectory() { return hostPath("/run/quarterd/assertions"); }

std::unique_ptr<TerminationAssertion> TerminationAssertion::make(const std::string& identifier, uint8_t reason,
                                                                 AcquisitionHandler acquired) {
  if (!usableName(identifier)) {
    errno = EINVAL;
    return nullptr;
  }
  auto state = std::make_shared<State>();
  state->identifier = identifier;
  state->reason = reason;
  // The service answers from a thread of its own, as the handler's contract says.
  auto grant = [state, acquired = std::move(acquired)] {
    std::optional<std::string> refusal;
    if (deviceRefusesTerminationAssertions()) {
      refusal = "the application lifecycle service refused the assertion";
    } else {
      std::lock_guard<std::mutex> hold(gHoldersLock);
      UniqueFd directory;
      int err = state->invalidated ? ECANCELED : openDirectory(&directory);
      const std::string content = std::to_string(state->reason) + "\n";
      if (!err && holders()[state->identifier] == 0)
        err = replaceFileAt(directory.get(), state->identifier, content.data(), content.size(), 0644);
      if (err) {
        if (holders()[state->identifier] == 0) holders().erase(state->identifier);
        refusal = std::string("cannot record the assertion: ") + strerror(err);
      } else {
        ++holders()[state->identifier];
        state->held = true;
      }
    }
    if (acquired) acquired(refusal);
  };
  try {
    std::thread(std::move(grant)).detach();
  } catch (const std::system_error& e) {
    errno = e.code().value() != 0 ? e.code().value() : EAGAIN;
    return nullptr;
  }
  return std::unique_ptr<TerminationAssertion>(new TerminationAssertion(std::move(state)));
}

TerminationAssertion::~TerminationAssertion() { invalidate(); }

void TerminationAssertion::invalidate() {
  std::lock_guard<std::mutex> hold(gHoldersLock);
  if (!state_) return;
  state_->invalidated = true;
  if (!state_->held) return;
  state_->held = false;
  auto it = holders().find(state_->identifier);
  if (it == holders().end() || --it->second > 0) return;
  holders().erase(it);
  UniqueFd directory;
  int err = openDirectory(&directory);
  if (!err && unlinkat(directory.get(), state_->identifier.c_str(), 0) != 0 && errno != ENOENT) err = errno;
  if (!err) err = syncDirectory(directory.get());
  if (err)
    QRTLog(kLogError, "Failed to remove termination assertion of %s: %s", state_->identifier.c_str(), strerror(err));
}

}  // namespace platform
