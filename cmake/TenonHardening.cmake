# Hardening of every binary the project builds (the daemon, tnctl, tests):
# what a memory-safety bug in code that parses hostile input can reach.
# docs/decisions.md says why each flag is here and where it is left out.

include(CheckCXXCompilerFlag)
include(CheckPIESupported)

# Position-independent executables (ASLR for the program itself): -fPIE for
# every object, -pie for every executable.
set(CMAKE_POSITION_INDEPENDENT_CODE ON)
check_pie_supported(OUTPUT_VARIABLE tenon_pie_output LANGUAGES C CXX)

# Checked bounds in the C++ library's containers (operator[], front(), ...).
add_compile_definitions(_GLIBCXX_ASSERTIONS)

add_compile_options(-fstack-protector-strong)
foreach(flag -fstack-clash-protection -fcf-protection)
  string(MAKE_C_IDENTIFIER "TENON_HAS${flag}" supported)
  check_cxx_compiler_flag(${flag} ${supported})
  if(${supported})
    add_compile_options(${flag})
  endif()
endforeach()

# Fortified libc calls need optimisation (glibc warns, and -Werror fails,
# without it), so only optimised builds get them; and not under the
# sanitizers, whose interceptors replace the same functions. -U first: some
# compilers define it already, and a second -D would warn.
if(NOT TENON_SANITIZE AND NOT TENON_FUZZ)
  add_compile_options("$<$<NOT:$<CONFIG:Debug>>:-U_FORTIFY_SOURCE;-D_FORTIFY_SOURCE=3>")
endif()

# Full RELRO: relocations done at start (immediate binding), then the GOT
# is read-only.
add_link_options(LINKER:-z,relro,-z,now)
