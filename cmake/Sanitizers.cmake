# Tests look at OSTREL_SANITIZED and OSTREL_THREAD_SANITIZED, where fewer rounds or other
# figures are wanted; the compilers' own names for it differ.
if(OSTREL_SANITIZER STREQUAL "address+undefined")
  # The library's own checks of places and sizes come with it.
  add_compile_definitions(OSTREL_SANITIZED _GLIBCXX_ASSERTIONS)
  add_compile_options(-fsanitize=address,undefined -fno-sanitize-recover=all
    -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
elseif(OSTREL_SANITIZER STREQUAL "thread")
  add_compile_definitions(OSTREL_SANITIZED OSTREL_THREAD_SANITIZED)
  add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
  add_link_options(-fsanitize=thread)
elseif(NOT OSTREL_SANITIZER STREQUAL "")
  message(FATAL_ERROR "OSTREL_SANITIZER is neither address+undefined nor thread")
endif()
if(OSTREL_FUZZERS)
  # All code shows a fuzzer where it went.
  add_compile_options(-fsanitize=fuzzer-no-link)
endif()
