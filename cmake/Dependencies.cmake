# Everything comes from Debian's packages (scripts/install-deps).
find_package(Threads REQUIRED)
# Debian's protobuf ships no CMake config: module mode is the one that works.
find_package(Protobuf MODULE REQUIRED)
# The gRPC config needs protobuf-compiler-grpc for grpc_cpp_plugin.
find_package(gRPC CONFIG REQUIRED)
find_package(PkgConfig REQUIRED)
pkg_check_modules(SQLITE3 REQUIRED IMPORTED_TARGET sqlite3)
pkg_check_modules(SODIUM REQUIRED IMPORTED_TARGET libsodium)
if(KEST_BUILD_TESTS)
  find_package(GTest REQUIRED)
endif()
if(KEST_BUILD_BENCH)
  find_package(benchmark REQUIRED)
endif()

find_program(KEST_GRPC_CPP_PLUGIN grpc_cpp_plugin REQUIRED)

# kest_protobuf_generate(<target> <proto> [GRPC]) adds the generated sources of
# one .proto file to <target>, with the output folder on its include path.
function(kest_protobuf_generate target proto)
  cmake_parse_arguments(ARG "GRPC" "" "" ${ARGN})
  get_filename_component(abs ${proto} ABSOLUTE)
  get_filename_component(dir ${abs} DIRECTORY)
  get_filename_component(stem ${abs} NAME_WE)
  set(out ${CMAKE_CURRENT_BINARY_DIR}/proto)
  file(MAKE_DIRECTORY ${out})
  set(srcs ${out}/${stem}.pb.cc ${out}/${stem}.pb.h)
  set(args --cpp_out=${out} -I ${dir} -I ${PROJECT_SOURCE_DIR}/src/recordset)
  if(ARG_GRPC)
    list(APPEND srcs ${out}/${stem}.grpc.pb.cc ${out}/${stem}.grpc.pb.h)
    list(APPEND args --grpc_out=${out} --plugin=protoc-gen-grpc=${KEST_GRPC_CPP_PLUGIN})
  endif()
  add_custom_command(OUTPUT ${srcs}
    COMMAND protobuf::protoc ${args} ${abs}
    DEPENDS ${abs} protobuf::protoc
    COMMENT "Generating C++ from ${stem}.proto")
  target_sources(${target} PRIVATE ${srcs})
  target_include_directories(${target} PUBLIC ${out})
  # Generated code is not ours to keep warning-free.
  set_source_files_properties(${srcs} PROPERTIES COMPILE_OPTIONS "-w")
endfunction()
