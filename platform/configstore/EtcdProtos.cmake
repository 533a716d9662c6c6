# C++ stubs for etcd's v3 API, generated at build time from the protocol files
# that Debian ships with etcd's Go sources (golang-etcd-server-dev). The files
# import each other by etcd's repository paths ("etcd/mvcc/mvccpb/kv.proto"),
# so a folder in the build tree maps "etcd" onto the installed sources.

find_program(PROTOC protoc REQUIRED)
find_program(GRPC_CPP_PLUGIN grpc_cpp_plugin REQUIRED)
pkg_check_modules(GRPCXX REQUIRED IMPORTED_TARGET grpc++ protobuf)

set(KARST_GOCODE "/usr/share/gocode/src" CACHE PATH "Root of Debian's Go sources (etcd's protocol files)")
set(_etcd_src "${KARST_GOCODE}/go.etcd.io/etcd")
set(_gogo_root "${KARST_GOCODE}/github.com/gogo/protobuf")
set(_googleapis "${KARST_GOCODE}/github.com/grpc-ecosystem/grpc-gateway/third_party/googleapis")
foreach(_f "${_etcd_src}/etcdserver/etcdserverpb/rpc.proto" "${_gogo_root}/gogoproto/gogo.proto"
        "${_googleapis}/google/api/annotations.proto")
  if(NOT EXISTS "${_f}")
    message(FATAL_ERROR "missing ${_f}: install golang-etcd-server-dev (scripts/install-deps)")
  endif()
endforeach()

set(_proto_root "${CMAKE_CURRENT_BINARY_DIR}/etcd-proto-root")
file(MAKE_DIRECTORY "${_proto_root}")
file(CREATE_LINK "${_etcd_src}" "${_proto_root}/etcd" SYMBOLIC)
set(_protoc_includes -I "${_proto_root}" -I "${_gogo_root}" -I "${_googleapis}" -I /usr/include)

# Generates the stubs into "out", with protoc's C++ options "options" ("" or
# "lite:"), and returns in "var" the sources of "messages" (the files to
# compile; the other imports are there for their headers) and the service.
function(_karst_etcd_stubs var out options comment messages)
  file(MAKE_DIRECTORY "${out}")
  set(_generated)
  foreach(_m IN LISTS messages)
    list(APPEND _generated "${out}/${_m}.pb.cc")
  endforeach()
  list(APPEND _generated "${out}/etcd/etcdserver/etcdserverpb/rpc.grpc.pb.cc")
  add_custom_command(
    OUTPUT ${_generated}
    COMMAND "${PROTOC}" ${_protoc_includes} --cpp_out=${options}${out}
            etcd/mvcc/mvccpb/kv.proto etcd/auth/authpb/auth.proto gogoproto/gogo.proto
            google/api/annotations.proto google/api/http.proto etcd/etcdserver/etcdserverpb/rpc.proto
    COMMAND "${PROTOC}" ${_protoc_includes} --grpc_out=${out}
            --plugin=protoc-gen-grpc=${GRPC_CPP_PLUGIN} etcd/etcdserver/etcdserverpb/rpc.proto
    DEPENDS "${_etcd_src}/etcdserver/etcdserverpb/rpc.proto"
    COMMENT "${comment}"
    VERBATIM)
  set(${var} ${_generated} PARENT_SCOPE)
endfunction()

set(_proto_out "${CMAKE_CURRENT_BINARY_DIR}/etcd-proto")
set(_messages etcd/mvcc/mvccpb/kv etcd/auth/authpb/auth gogoproto/gogo google/api/annotations
              google/api/http etcd/etcdserver/etcdserverpb/rpc)
_karst_etcd_stubs(_generated "${_proto_out}" "" "Generating C++ stubs for etcd's v3 API"
  "${_messages}")

# Generated code: none of the project's warnings apply to it.
add_library(etcdproto STATIC ${_generated})
target_compile_options(etcdproto PRIVATE -w)
target_include_directories(etcdproto SYSTEM PUBLIC "${_proto_out}")
target_link_libraries(etcdproto PUBLIC PkgConfig::GRPCXX)

# The same messages for protobuf's lite runtime, which registers no
# descriptors: a program that links configstore (which keeps its copy of the
# full ones hidden inside) may link these beside it, where a second full copy
# aborts at start-up ("File already exists in database"). For the benchmarks'
# raw etcd client; only what the KV calls need is compiled.
set(_lite_out "${CMAKE_CURRENT_BINARY_DIR}/etcd-proto-lite")
set(_lite_messages etcd/mvcc/mvccpb/kv etcd/auth/authpb/auth etcd/etcdserver/etcdserverpb/rpc)
_karst_etcd_stubs(_lite_generated "${_lite_out}" "lite:"
  "Generating C++ stubs for etcd's v3 API (lite runtime)" "${_lite_messages}")
add_library(etcdproto_lite STATIC EXCLUDE_FROM_ALL ${_lite_generated})
target_compile_options(etcdproto_lite PRIVATE -w)
target_include_directories(etcdproto_lite SYSTEM PUBLIC "${_lite_out}")
target_link_libraries(etcdproto_lite PUBLIC PkgConfig::GRPCXX)
