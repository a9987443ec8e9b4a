#pragma once

// The two functions by which libFuzzer, or the replaying program in its place, runs a target.

#include <cstddef>
#include <cstdint>

// Called once, before the first input.
extern "C" int LLVMFuzzerInitialize(int* argumentCount, char*** arguments);

// Runs one input; returns 0. Each target defines its own.
extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size);
