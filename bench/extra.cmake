# The stream benchmark measures the wire format against msgpack-c (header-only, Debian package
# libmsgpack-cxx-dev).
find_package(msgpack CONFIG REQUIRED)
if(TARGET bench_stream)
  target_link_libraries(bench_stream PRIVATE msgpackc-cxx)
endif()
