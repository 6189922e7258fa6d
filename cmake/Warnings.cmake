# Compiler flags shared by every target: warnings, hardening, sanitizers.
add_compile_options(-Wall -Wextra -Wpedantic)
if(ZLKA_WERROR)
  add_compile_options(-Werror)
endif()

# Hardening that costs nothing measurable.
add_compile_options(-fstack-protector-strong)
add_compile_definitions($<$<NOT:$<CONFIG:Debug>>:_FORTIFY_SOURCE=2>)
add_compile_definitions(_GLIBCXX_ASSERTIONS)
add_link_options(-Wl,-z,relro,-z,now)
set(CMAKE_POSITION_INDEPENDENT_CODE ON)

if(ZLKA_SANITIZE)
  add_compile_options(-fsanitize=${ZLKA_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  if(CMAKE_CXX_COMPILER_ID STREQUAL "GNU")
    # Sanitizer instrumentation makes GCC's flow analysis report uninitialized values that are not.
    add_compile_options(-Wno-maybe-uninitialized)
    # GCC warns that ThreadSanitizer does not model the fences inside Asio's headers.
    if(ZLKA_SANITIZE MATCHES "thread")
      add_compile_options(-Wno-tsan)
    endif()
  endif()
  add_link_options(-fsanitize=${ZLKA_SANITIZE})
endif()

if(ZLKA_FUZZ)
  if(NOT CMAKE_CXX_COMPILER_ID MATCHES "Clang")
    message(FATAL_ERROR "ZLKA_FUZZ needs clang")
  endif()
  add_compile_options(-fsanitize=fuzzer-no-link,address,undefined -fno-sanitize-recover=all)
  add_link_options(-fsanitize=address,undefined)
endif()
