# The TA as a TEE builds it: aarch64, freestanding, no C++ runtime. Each
# source compiles to an object with its stack usage (.su) and call graph
# (.ci) beside it; the objects link into one relocatable object whose
# undefined symbols are all the TA needs from the TEE.
find_program(KM_TA_CXX aarch64-linux-gnu-g++ REQUIRED)
find_program(KM_TA_NM aarch64-linux-gnu-nm REQUIRED)
find_program(KM_TA_READELF aarch64-linux-gnu-readelf REQUIRED)

# -Os as TEE development kits build TAs. The stack protector is left to the
# TEE's own kit, which then also provides __stack_chk_guard and __stack_chk_fail.
set(KM_TA_FREESTANDING_FLAGS
    -std=c++20 -Os -ffreestanding -fno-exceptions -fno-rtti -fno-asynchronous-unwind-tables -fno-unwind-tables
    -fno-threadsafe-statics -fno-stack-protector
    -Wall -Wextra -Wshadow -Wformat=2 -Wnon-virtual-dtor -Wcast-qual -Werror)

# km_freestanding_object(NAME SOURCES src... INCLUDES dir...) - builds
# ${CMAKE_CURRENT_BINARY_DIR}/NAME.o from the sources (part of the default
# build); the per-source objects, .su and .ci files are in the directory NAME.
function(km_freestanding_object name)
  cmake_parse_arguments(arg "" "" "SOURCES;INCLUDES" ${ARGN})
  set(dir ${CMAKE_CURRENT_BINARY_DIR}/${name})
  set(includes)
  foreach(inc ${arg_INCLUDES})
    list(APPEND includes -I${inc})
  endforeach()
  set(objects)
  foreach(src ${arg_SOURCES})
    get_filename_component(base ${src} NAME_WE)
    set(obj ${dir}/${base}.o)
    add_custom_command(
      OUTPUT ${obj} ${dir}/${base}.su ${dir}/${base}.ci
      COMMAND ${CMAKE_COMMAND} -E make_directory ${dir}
      COMMAND ${KM_TA_CXX} ${KM_TA_FREESTANDING_FLAGS} -fstack-usage -fcallgraph-info=su ${includes}
              -MD -MF ${obj}.d -c ${src} -o ${obj}
      DEPENDS ${src}
      DEPFILE ${obj}.d
      COMMENT "Building ${name}/${base}.o (aarch64, freestanding)"
      VERBATIM)
    list(APPEND objects ${obj})
  endforeach()
  add_custom_command(
    OUTPUT ${dir}.o
    COMMAND ${KM_TA_CXX} -r -nostdlib -o ${dir}.o ${objects}
    DEPENDS ${objects}
    COMMENT "Linking ${name}.o (aarch64, relocatable)"
    VERBATIM)
  add_custom_target(${name} ALL DEPENDS ${dir}.o)
endfunction()
