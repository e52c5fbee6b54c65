# Settings that every target of this project shares. They are set on the targets, never globally, and the
# warnings never reach a project that uses the library.

function(qel_configure_target target)
  target_compile_features(${target} PUBLIC cxx_std_17)
  target_compile_options(${target} PRIVATE
    -Wall -Wextra -Wpedantic -Wshadow -Wconversion -Wold-style-cast -Wnon-virtual-dtor -Woverloaded-virtual
    $<$<CXX_COMPILER_ID:Clang>:-Wthread-safety>
    $<$<BOOL:${QEL_WARNINGS_AS_ERRORS}>:-Werror>)

  if(QEL_SANITIZE)
    string(REPLACE ";" "," sanitizers "${QEL_SANITIZE}")
    target_compile_options(${target} PRIVATE
      -fsanitize=${sanitizers} -fno-sanitize-recover=all -fno-omit-frame-pointer)
    target_link_options(${target} PRIVATE -fsanitize=${sanitizers})
  endif()

  if(QEL_COVERAGE)
    target_compile_options(${target} PRIVATE --coverage -fprofile-update=atomic)
    target_link_options(${target} PRIVATE --coverage)
  endif()
endfunction()

# What leaves this project, the library and the program, is built so that a mistake in it is hard to exploit: a guard value
# on the stack, bounds checks in the C library's functions (these need optimisation), relocations that are read-only once
# the program runs, and no executable stack. The sanitizers bring their own checks.
function(qel_harden_target target)
  if(NOT QEL_HARDENING)
    return()
  endif()
  target_compile_options(${target} PRIVATE
    -fstack-protector-strong
    $<$<NOT:$<CONFIG:Debug>>:-U_FORTIFY_SOURCE>
    $<$<NOT:$<CONFIG:Debug>>:-D_FORTIFY_SOURCE=2>)
  get_target_property(type ${target} TYPE)
  if(NOT type STREQUAL "STATIC_LIBRARY")
    target_link_options(${target} PRIVATE -Wl,-z,relro -Wl,-z,now -Wl,-z,noexecstack)
  endif()
endfunction()
