# Every target that builds first makes sure the Debian packages are present.
JOBS ?= $(shell nproc)
CMAKE_GEN = cmake -G Ninja -Wno-dev
CTEST = ctest --output-on-failure --timeout 300 -j $(JOBS)

.PHONY: all deps build test asan tsan bench demo fuzz clean

all: build

deps:
	@bash tools/install-deps.sh

# The main build uses Clang so that -Wthread-safety checks every lock.
build/build.ninja: | deps
	$(CMAKE_GEN) -S . -B build -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ -DSORVIK_BUILD_FUZZ=ON

build: deps build/build.ninja
	cmake --build build -j $(JOBS)

test: build
	cd build && $(CTEST)

asan: deps
	$(CMAKE_GEN) -S . -B build-asan -DCMAKE_BUILD_TYPE=Debug -DSORVIK_SANITIZE=address \
	  -DCMAKE_C_COMPILER=gcc -DCMAKE_CXX_COMPILER=g++ -DSORVIK_BUILD_BENCH=OFF
	cmake --build build-asan -j $(JOBS)
	cd build-asan && ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 $(CTEST)

tsan: deps
	$(CMAKE_GEN) -S . -B build-tsan -DCMAKE_BUILD_TYPE=RelWithDebInfo -DSORVIK_SANITIZE=thread \
	  -DCMAKE_C_COMPILER=clang -DCMAKE_CXX_COMPILER=clang++ -DSORVIK_BUILD_BENCH=OFF
	cmake --build build-tsan -j $(JOBS)
	cd build-tsan && TSAN_OPTIONS=halt_on_error=1:second_deadlock_stack=1 $(CTEST)

bench: deps
	$(CMAKE_GEN) -S . -B build-release -DCMAKE_BUILD_TYPE=Release -DSORVIK_BUILD_TESTS=OFF \
	  -DCMAKE_C_COMPILER=gcc -DCMAKE_CXX_COMPILER=g++
	cmake --build build-release -j $(JOBS)
	bash tools/run-benchmarks.sh build-release

demo: build
	bash tools/demo.sh build

# make fuzz [FUZZ_SECONDS=600]
FUZZ_SECONDS ?= 60
fuzz: build
	bash tools/run-fuzzers.sh build $(FUZZ_SECONDS)

clean:
	rm -rf build build-asan build-tsan build-release

# Windows x64 DLL, cross-built with MinGW-w64; its tests run under Wine.
# Third-party sources and the Wine prefix live in WINDOWS_CACHE, outside git.
WINDOWS_CACHE ?= $(HOME)/.cache/sorvik-windows
WINDOWS_BUILD ?= build-win
# Release: no debug information to compile and link keeps CI short.
WINDOWS_BUILD_TYPE ?= Release

.PHONY: windows test-windows

windows:
	@bash tools/install-windows-deps.sh
	@bash tools/fetch-windows-sources.sh $(WINDOWS_CACHE)
	$(CMAKE_GEN) -S . -B $(WINDOWS_BUILD) -DCMAKE_TOOLCHAIN_FILE=cmake/mingw-w64-toolchain.cmake \
	  -DCMAKE_BUILD_TYPE=$(WINDOWS_BUILD_TYPE) -DSORVIK_BUILD_BENCH=OFF \
	  -DSORVIK_WINDOWS_SOURCES=$(WINDOWS_CACHE)/src
	cmake --build $(WINDOWS_BUILD) -j $(JOBS)

test-windows: windows
	cd $(WINDOWS_BUILD) && SORVIK_WINDOWS_CACHE=$(WINDOWS_CACHE) $(CTEST); \
	  rc=$$?; SORVIK_WINDOWS_CACHE=$(WINDOWS_CACHE) bash $(CURDIR)/tools/wine-run.sh --stop; exit $$rc
