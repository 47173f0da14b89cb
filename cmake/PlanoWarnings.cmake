# Warnings are errors everywhere; sanitizers are a build-wide switch so every target,
# the tests and the libraries they load agree on the runtime.
add_compile_options(-Wall -Wextra -Wpedantic -Werror)
# Products and sums are never fused into one rounding, so results have the same bits on every
# CPU: g++ is told per function where it matters (PLX_NO_FP_CONTRACT); clang, which has no such
# attribute and fuses within an expression by default, is told for the whole build.
if(CMAKE_CXX_COMPILER_ID MATCHES "Clang")
  add_compile_options(-ffp-contract=off)
endif()
if(PLANO_SANITIZE)
  add_compile_options(-fsanitize=address,undefined -fno-sanitize-recover=all -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
endif()
# Fuzzing gives every object libFuzzer's coverage hooks as well as the sanitizers, so a fault
# anywhere below a reader is found and its paths guide the search; only the fuzz targets link
# libFuzzer's main (fuzz/CMakeLists.txt), the other programs of such a build run as usual.
if(PLANO_FUZZ)
  if(NOT CMAKE_CXX_COMPILER_ID MATCHES "Clang" OR NOT CMAKE_C_COMPILER_ID MATCHES "Clang")
    message(FATAL_ERROR "PLANO_FUZZ needs clang: -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++")
  endif()
  add_compile_options(-fsanitize=fuzzer-no-link,address,undefined -fno-sanitize-recover=all
                      -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
endif()

# plano_target_sources(TARGET DIR...) adds every .cpp below the given folders: each file holds
# one topic, and new topics join the build without editing the list.
function(plano_glob_sources out)
  set(files)
  foreach(dir IN LISTS ARGN)
    file(GLOB found CONFIGURE_DEPENDS "${dir}/*.cpp" "${dir}/*.c")
    list(APPEND files ${found})
  endforeach()
  list(SORT files)
  set(${out} ${files} PARENT_SCOPE)
endfunction()
