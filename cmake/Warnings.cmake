function(kest_set_warnings target)
  target_compile_options(${target} INTERFACE -Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor
    -Wold-style-cast -Wcast-align -Woverloaded-virtual -Wnull-dereference -Wimplicit-fallthrough)
  if(KEST_WERROR)
    target_compile_options(${target} INTERFACE -Werror)
  endif()
endfunction()
