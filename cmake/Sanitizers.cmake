# QUORVEL_SANITIZE=address builds with ASan+UBSan, =thread with TSan.
if(QUORVEL_SANITIZE STREQUAL "address")
  add_compile_options(-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=undefined)
  add_link_options(-fsanitize=address,undefined)
elseif(QUORVEL_SANITIZE STREQUAL "thread")
  add_compile_options(-fsanitize=thread -fno-omit-frame-pointer)
  add_link_options(-fsanitize=thread)
elseif(NOT QUORVEL_SANITIZE STREQUAL "")
  message(FATAL_ERROR "QUORVEL_SANITIZE must be empty, 'address' or 'thread'")
endif()

# The fuzz build instruments the libraries for coverage; only the fuzz
# targets link libFuzzer's main.
if(QUORVEL_FUZZ)
  add_compile_options(-fsanitize=fuzzer-no-link,address,undefined -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
endif()

# QUORVEL_COVERAGE=ON instruments everything for gcov (scripts/coverage).
option(QUORVEL_COVERAGE "Build with gcov instrumentation" OFF)
if(QUORVEL_COVERAGE)
  add_compile_options(--coverage -fprofile-update=atomic)
  add_link_options(--coverage)
endif()
