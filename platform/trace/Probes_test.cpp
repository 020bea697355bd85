#include "platform/trace/Probes.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <string>

namespace {

// No tracer is attached while unit tests run, so every semaphore reads zero and the guarded
// argument is never built.
TEST(Probes, DisabledProbeDoesNotBuildItsArguments) {
  int built = 0;
  auto describe = [&built] {
    ++built;
    return std::string("reply");
  };
  if (EK_PROBE_ENABLED(request_output)) EK_PROBE2(request_output, 1, describe().c_str());
  EXPECT_EQ(built, 0);
}

TEST(Probes, EveryProbeFires) {
  int pid = 42;
  std::string text = "text";
  uint64_t code = 2;
  unsigned count = 3;
  bool flag = true;
  EK_PROBE1(client_new, pid);
  EK_PROBE1(client_done, pid);
  EK_PROBE2(request_input, pid, text.c_str());
  EK_PROBE2(request, pid, text.c_str());
  EK_PROBE2(request_output, pid, text.c_str());
  EK_PROBE2(db_load, text.c_str(), code);
  EK_PROBE1(discover_raw, count);
  EK_PROBE1(plugin_add, text.c_str());
  EK_PROBE2(plugin_remove, text.c_str(), flag);
  EK_PROBE1(plugin_ready, text.c_str());
  EXPECT_FALSE(EK_PROBE_ENABLED(client_new));
  EXPECT_FALSE(EK_PROBE_ENABLED(plugin_ready));
}

}  // namespace
