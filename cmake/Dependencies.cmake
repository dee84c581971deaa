# Every dependency comes from Debian's packages (scripts/bootstrap.sh installs them).
find_package(Threads REQUIRED)
find_package(PkgConfig REQUIRED)
find_package(nlohmann_json 3.10 REQUIRED)
find_package(fmt REQUIRED)
find_package(spdlog REQUIRED)
find_package(tomlplusplus REQUIRED)
find_package(CLI11 REQUIRED)
find_package(sdbus-c++ REQUIRED)
pkg_check_modules(SYSTEMD REQUIRED IMPORTED_TARGET libsystemd)
pkg_check_modules(SQLITE3 REQUIRED IMPORTED_TARGET sqlite3)
pkg_check_modules(RDKAFKA REQUIRED IMPORTED_TARGET rdkafka)

find_path(ASIO_INCLUDE_DIR asio.hpp REQUIRED)
find_path(SDT_INCLUDE_DIR sys/sdt.h REQUIRED)

set(TAVRIN_LINUX_DEPENDENCIES
    spdlog::spdlog
    tomlplusplus::tomlplusplus
    SDBusCpp::sdbus-c++
    PkgConfig::SYSTEMD
    PkgConfig::SQLITE3
    PkgConfig::RDKAFKA)

if(TAVRIN_BUILD_TESTS)
  find_package(GTest REQUIRED)
endif()
if(TAVRIN_BUILD_BENCH)
  find_package(benchmark REQUIRED)
endif()
