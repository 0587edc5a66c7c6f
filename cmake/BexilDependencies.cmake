# Every dependency is a Debian package installed by scripts/bootstrap; nothing is downloaded here.
find_package(PkgConfig REQUIRED)
find_package(Threads REQUIRED)
if(BUILD_TESTING)
    find_package(GTest REQUIRED)
endif()
find_package(fmt REQUIRED)
find_package(pugixml REQUIRED)
# The application registry's store; only src/platform/ledgerix includes it.
find_package(SQLite3 REQUIRED)
# Digests and sandbox-token signatures (libcrypto only).
find_package(OpenSSL REQUIRED COMPONENTS Crypto)
pkg_check_modules(SYSTEMD REQUIRED IMPORTED_TARGET libsystemd)
if(BEXIL_BENCH AND NOT BEXIL_FUZZ)
    find_package(benchmark REQUIRED)
endif()

# Standalone Asio is header-only; it may only be included from .cpp files of src/base and src/platform/zem.
find_path(ASIO_INCLUDE_DIR asio.hpp REQUIRED)
add_library(bexil_asio INTERFACE)
target_include_directories(bexil_asio SYSTEM INTERFACE ${ASIO_INCLUDE_DIR})
target_compile_definitions(bexil_asio INTERFACE ASIO_STANDALONE ASIO_NO_DEPRECATED)
target_link_libraries(bexil_asio INTERFACE Threads::Threads)
find_package(CLI11 CONFIG REQUIRED)
# JSON text of values for the tool and the C interface (src/client/JsonText.cpp only): header-only.
find_package(nlohmann_json 3.11 CONFIG REQUIRED)
