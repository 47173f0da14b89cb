# Warnings are errors everywhere; sanitizers are a build-wide switch so every target,
# the tests and the libraries they load agree on the runtime.
add_compile_options(-Wall -Wextra -Wpedantic -Werror)
if(PLANO_SANITIZE)
  add_compile_options(-fsanitize=address,undefined -fno-sanitize-recover=all -fno-omit-frame-pointer)
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
