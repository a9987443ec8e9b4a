#include <glog/logging.h>

#include "harness/Fuzzing.h"

// Damaged input is what these programs live on: a line in the log for each would be all they do.
int LLVMFuzzerInitialize(int* /*argumentCount*/, char*** /*arguments*/) {
  FLAGS_minloglevel = google::GLOG_FATAL;
  return 0;
}
