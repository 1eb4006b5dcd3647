// Application termination assertions: while one is held the named
// application is ended and kept from running. A held assertion is the file
// R/run/quarterd/assertions/IDENTIFIER holding the reason code; the device
// property RefuseTerminationAssertions makes the service refuse every one.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace platform {

class TerminationAssertion {
 public:
  // Called once, on a thread of its own: nothing when the assertion was
  // acquired, else the reason it was not.
  using AcquisitionHandler = std::function<void(const std::optional<std::string>& error)>;

  // Nothing (errno set) when no assertion can be made for the identifier at
  // all; otherwise the handler will be called.
  static std::unique_ptr<TerminationAssertion> make(const std::string& identifier, uint8_t reason,
                                                    AcquisitionHandler acquired);
  ~TerminationAssertion();
  TerminationAssertion(const TerminationAssertion&) = delete;
  TerminationAssertion& operator=(const TerminationAssertion&) = delete;

  // Gives the assertion up; a second call does nothing.
  void invalidate();

  struct State;

 private:
  explicit TerminationAssertion(std::shared_ptr<State> state) : state_(std::move(state)) {}
  std::shared_ptr<State> state_;
};

// The directory of held assertions (host path).
std::string terminationAssertionDirectory();

}  // namespace platform
