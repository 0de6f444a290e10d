# How every target of the project is compiled, and the functions that declare modules and tests.

# What all of our own code is compiled with.
add_library(fieldkit_options INTERFACE)
target_compile_features(fieldkit_options INTERFACE cxx_std_20)
target_compile_definitions(fieldkit_options INTERFACE _FILE_OFFSET_BITS=64)
target_compile_options(fieldkit_options INTERFACE
  -Wall -Wextra -Wshadow -Wconversion -Wformat=2 -Wundef -Wpointer-arith -Wcast-qual
  -Wwrite-strings -Wmissing-declarations -Wvla
  $<$<BOOL:${FIELDKIT_WERROR}>:-Werror>)
if(FIELDKIT_SANITIZE)
  target_compile_options(fieldkit_options INTERFACE
    -fsanitize=${FIELDKIT_SANITIZE} -fno-omit-frame-pointer -fno-sanitize-recover=all)
  target_link_options(fieldkit_options INTERFACE -fsanitize=${FIELDKIT_SANITIZE})
endif()
if(FIELDKIT_FUZZ)
  # Only the fuzzers themselves are linked with libFuzzer's main program.
  target_compile_options(fieldkit_options INTERFACE -fsanitize=fuzzer-no-link)
endif()

# What the product itself is compiled with on top: it must run where no C++ run-time library is
# installed, so nothing may need one.
add_library(fieldkit_product_options INTERFACE)
target_link_libraries(fieldkit_product_options INTERFACE fieldkit_options)
target_compile_options(fieldkit_product_options INTERFACE
  -fno-exceptions -fno-rtti -fno-threadsafe-statics -ffunction-sections -fdata-sections
  # A broken invariant ends the program in a release, too: on a device nobody would see it otherwise.
  -UNDEBUG)
target_link_options(fieldkit_product_options INTERFACE -Wl,--gc-sections)

# fieldkit_module(NAME SOURCES file... [LINKS target...])
#
# Declares src/NAME as the static library fieldkit_NAME. Its headers are reached as "NAME/file.h",
# and only by targets that link it: the include directory that it publishes holds a single link to
# its own folder. An include against the direction of the dependencies therefore does not compile.
function(fieldkit_module name)
  cmake_parse_arguments(PARSE_ARGV 1 arg "" "" "SOURCES;LINKS")
  set(include_dir ${CMAKE_BINARY_DIR}/include/${name})
  file(MAKE_DIRECTORY ${include_dir})
  file(CREATE_LINK ${CMAKE_CURRENT_SOURCE_DIR} ${include_dir}/${name} SYMBOLIC)
  add_library(fieldkit_${name} STATIC ${arg_SOURCES})
  # Nothing outside the executable looks its functions up: on MIPS the dynamic linker would do that
  # for each of them at every start.
  target_compile_options(fieldkit_${name} PRIVATE -fvisibility=hidden)
  target_include_directories(fieldkit_${name} PUBLIC ${include_dir})
  target_link_libraries(fieldkit_${name} PUBLIC ${arg_LINKS} PRIVATE fieldkit_product_options)
endfunction()
