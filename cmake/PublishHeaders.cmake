# Each library target publishes only its own headers: a directory of the build tree holding links
# to them under the paths the sources include them by (platform/listener/listener.h), which becomes the
# target's include directory. A source that includes a header of a library its target does not link
# then fails to compile, so the links between targets must follow the layering that
# `scripts/lint --layers` checks. Tests, benchmarks and fuzzers keep the whole tree on their path.
#
#   zlka_publish_headers(TARGET ROOT PATTERN...)  links ROOT/PATTERN (globs) into the target's set
function(zlka_publish_headers target root)
  set(published ${PROJECT_BINARY_DIR}/include/${target})
  foreach(pattern ${ARGN})
    file(GLOB headers CONFIGURE_DEPENDS RELATIVE ${root} ${root}/${pattern})
    if(NOT headers)
      message(FATAL_ERROR "zlka_publish_headers(${target}): no header matches ${root}/${pattern}")
    endif()
    foreach(header ${headers})
      get_filename_component(directory ${published}/${header} DIRECTORY)
      file(MAKE_DIRECTORY ${directory})
      file(CREATE_LINK ${root}/${header} ${published}/${header} SYMBOLIC)
    endforeach()
  endforeach()
  target_include_directories(${target} PUBLIC ${published})
endfunction()
