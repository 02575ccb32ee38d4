# What every target of this tree shares: the include root, the warnings, and for the product the
# promise that nothing throws and nothing needs run-time type information.

add_library(zq3_common INTERFACE)
target_include_directories(zq3_common INTERFACE ${PROJECT_SOURCE_DIR}/include ${PROJECT_SOURCE_DIR})
target_compile_options(zq3_common INTERFACE
  -Wall -Wextra -Wpedantic -Wshadow -Wconversion -Werror
  # The source path of a memory request is logged; it must not depend on where the tree was built.
  -ffile-prefix-map=${PROJECT_SOURCE_DIR}/=)
# Files of more than 2 GiB on 32-bit builds too.
target_compile_definitions(zq3_common INTERFACE _FILE_OFFSET_BITS=64)

add_library(zq3_product INTERFACE)
target_link_libraries(zq3_product INTERFACE zq3_common)
target_compile_options(zq3_product INTERFACE -fno-exceptions -fno-rtti)
