# Sets CELLAR_HAS_COROUTINES if the compiler has those of C++20. The libraries get by without; one header is for them.
include(CheckCXXSourceCompiles)
function(cellar_look_for_coroutines)
  set(CMAKE_CXX_STANDARD 20)
  check_cxx_source_compiles("#include <coroutine>\n#if !__cpp_impl_coroutine\n#error none\n#endif\nint main() {}"
    CELLAR_HAS_COROUTINES)
endfunction()
cellar_look_for_coroutines()
