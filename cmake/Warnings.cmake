# One warning set for every target of ours, clean on g++ and mingw-w64 g++.
function(skyvane_warnings target)
  target_compile_options(${target} PRIVATE
    -Wall -Wextra -Wpedantic -Wshadow -Wconversion -Wsign-conversion
    -Wnon-virtual-dtor -Wold-style-cast -Wcast-align -Woverloaded-virtual
    -Wnull-dereference -Wdouble-promotion -Wformat=2 -Wimplicit-fallthrough)
  if(SKYVANE_WERROR)
    target_compile_options(${target} PRIVATE -Werror)
  endif()
endfunction()
