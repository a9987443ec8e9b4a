#pragma once

namespace velmora::mobile::xplat::cellar {

// What somebody is to call while the caller waits. Does not own it, and so costs neither memory nor, as a template
// would, code for each use.
class FunctionReference {
 public:
  template <class Function>
  FunctionReference(const Function& function)  // NOLINT(google-explicit-constructor): stands for the function
      : function_(&function), call_([](const void* target) { (*static_cast<const Function*>(target))(); }) {}

  void operator()() const { call_(function_); }

 private:
  const void* const function_;
  void (*const call_)(const void*);
};

}  // namespace velmora::mobile::xplat::cellar
