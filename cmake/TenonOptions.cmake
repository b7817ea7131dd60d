# Compiler flags shared by every target of the project.

add_compile_options(-Wall -Wextra -Wpedantic -Wshadow -Wnon-virtual-dtor
                    -Wold-style-cast -Wcast-align -Woverloaded-virtual)
if(TENON_WERROR)
  add_compile_options(-Werror)
endif()

if(TENON_SANITIZE)
  add_compile_options(-fsanitize=${TENON_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  add_link_options(-fsanitize=${TENON_SANITIZE})
endif()

if(TENON_FUZZ)
  # Libraries get coverage instrumentation; the targets add -fsanitize=fuzzer.
  add_compile_options(-fsanitize=fuzzer-no-link,address,undefined -fno-omit-frame-pointer)
  add_link_options(-fsanitize=address,undefined)
endif()

# tenon_library(NAME SOURCES...): one CMake library target per folder, whose
# public include root is the repository root ("platform/value/Value.h").
function(tenon_library name)
  add_library(${name} STATIC ${ARGN})
  target_include_directories(${name} PUBLIC ${PROJECT_SOURCE_DIR})
endfunction()
