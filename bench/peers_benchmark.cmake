# Extra links of peers_benchmark: the LMDB and RocksDB backends are built
# only when their libraries are found (Debian: liblmdb-dev, librocksdb-dev).
# Included by bench/CMakeLists.txt with KOV_BENCH = peers_benchmark.
find_package(PkgConfig QUIET)
if(PkgConfig_FOUND)
  pkg_check_modules(KOV_PEERS_LMDB QUIET IMPORTED_TARGET lmdb)
  pkg_check_modules(KOV_PEERS_ROCKSDB QUIET IMPORTED_TARGET rocksdb)
endif()

if(KOV_PEERS_LMDB_FOUND)
  target_link_libraries(${KOV_BENCH} PRIVATE PkgConfig::KOV_PEERS_LMDB)
  target_compile_definitions(${KOV_BENCH} PRIVATE KOV_PEERS_HAVE_LMDB)
else()
  find_library(KOV_PEERS_LMDB_LIBRARY lmdb)
  find_path(KOV_PEERS_LMDB_INCLUDE lmdb.h)
  if(KOV_PEERS_LMDB_LIBRARY AND KOV_PEERS_LMDB_INCLUDE)
    target_include_directories(${KOV_BENCH} SYSTEM PRIVATE "${KOV_PEERS_LMDB_INCLUDE}")
    target_link_libraries(${KOV_BENCH} PRIVATE "${KOV_PEERS_LMDB_LIBRARY}")
    target_compile_definitions(${KOV_BENCH} PRIVATE KOV_PEERS_HAVE_LMDB)
  endif()
endif()

# RocksDB's pkg-config file lists only the library itself; its headers are
# in the default include path on Debian.
find_library(KOV_PEERS_ROCKSDB_LIBRARY rocksdb)
find_path(KOV_PEERS_ROCKSDB_INCLUDE rocksdb/db.h)
if(KOV_PEERS_ROCKSDB_LIBRARY AND KOV_PEERS_ROCKSDB_INCLUDE)
  target_include_directories(${KOV_BENCH} SYSTEM PRIVATE "${KOV_PEERS_ROCKSDB_INCLUDE}")
  target_link_libraries(${KOV_BENCH} PRIVATE "${KOV_PEERS_ROCKSDB_LIBRARY}")
  target_compile_definitions(${KOV_BENCH} PRIVATE KOV_PEERS_HAVE_ROCKSDB)
endif()

if(KOV_PEERS_LMDB_FOUND OR KOV_PEERS_LMDB_LIBRARY)
  message(STATUS "peers_benchmark: LMDB backend built")
else()
  message(STATUS "peers_benchmark: LMDB not found, its backend is not built")
endif()
if(KOV_PEERS_ROCKSDB_LIBRARY AND KOV_PEERS_ROCKSDB_INCLUDE)
  message(STATUS "peers_benchmark: RocksDB backend built")
else()
  message(STATUS "peers_benchmark: RocksDB not found, its backend is not built")
endif()
