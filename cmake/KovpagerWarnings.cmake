# Warning flags and sanitizers for the project's own targets. Nothing here
# is PUBLIC: a host that links kovpager never inherits -Werror or sanitizers.

function(kovpager_warnings target)
  if(MSVC)
    target_compile_options(${target} PRIVATE /W4)
  else()
    target_compile_options(${target} PRIVATE -Wall -Wextra -Wpedantic)
    if(KOVPAGER_WERROR)
      target_compile_options(${target} PRIVATE -Werror)
    endif()
  endif()
endfunction()

# KOVPAGER_SANITIZE is a comma-separated list handed to -fsanitize; it
# applies to every target of the build, tests included.
if(KOVPAGER_SANITIZE)
  string(REPLACE ";" "," _kov_sanitize "${KOVPAGER_SANITIZE}")
  add_compile_options(-fsanitize=${_kov_sanitize} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${_kov_sanitize})
endif()
