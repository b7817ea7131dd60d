# Every external dependency is a Debian package installed by scripts/setup.

find_package(Threads REQUIRED)
find_package(PkgConfig REQUIRED)
find_package(fmt REQUIRED)
find_package(pugixml REQUIRED)
find_package(nlohmann_json REQUIRED)
find_package(OpenSSL REQUIRED)
pkg_check_modules(SYSTEMD REQUIRED IMPORTED_TARGET libsystemd)

if(NOT TENON_FUZZ)
  find_package(GTest REQUIRED)
  find_package(CLI11 REQUIRED)
  if(TENON_BENCH)
    find_package(benchmark REQUIRED)
  endif()
endif()
