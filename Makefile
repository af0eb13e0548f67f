# A thin front over CMake so that the everyday commands are short.
#   make demo   build everything and render the demo farm on this machine
#   make demo-blender, make demo-povray   the same farm with a real renderer
#   make install PREFIX=/usr/local   daemon, tools and wrappers in PREFIX/bin
#   make test   build and run every test (plain build)
#   make asan   build and run every test with AddressSanitizer + UBSan
#   make fuzz   build the fuzzers with clang and run each for a bounded time
#   make bench  build the benchmarks and report them
JOBS ?= $(shell nproc 2>/dev/null || echo 2)
BUILD ?= build
FUZZ_SECONDS ?= 60
PREFIX ?= /usr/local

.PHONY: all deps configure build test asan fuzz bench demo demo-blender demo-povray install format clean

all: build

deps:
	@tools/install-deps.sh

configure: deps
	cmake -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo >/dev/null

build: configure
	cmake --build $(BUILD) -j $(JOBS)

# The tests also drive the real renderers the wrappers run, so they are
# installed here (large; the demo does not need them).
test: build
	@RJ_WITH_RENDERERS=1 tools/install-deps.sh
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)

asan: deps
	cmake -S . -B $(BUILD)-asan -DCMAKE_BUILD_TYPE=Debug -DRJ_SANITIZE=ON -DRJ_BENCH=OFF >/dev/null
	cmake --build $(BUILD)-asan -j $(JOBS)
	cd $(BUILD)-asan && ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=print_stacktrace=1 ctest --output-on-failure -j $(JOBS)

fuzz:
	@RJ_NEED_CLANG=1 tools/install-deps.sh
	CC=clang CXX=clang++ cmake -S . -B $(BUILD)-fuzz -DCMAKE_BUILD_TYPE=Debug -DRJ_FUZZ=ON >/dev/null
	cmake --build $(BUILD)-fuzz -j $(JOBS)
	tests/fuzz/run.sh $(BUILD)-fuzz $(FUZZ_SECONDS)

bench: build
	bench/run.sh $(BUILD)

# Only what the demo runs: the daemon and the demo render program.
demo: configure
	cmake --build $(BUILD) -j $(JOBS) --target zarno_render_demon frame_painter
	demo/run.sh $(BUILD)

demo-blender demo-povray: configure
	@RJ_WITH_RENDERERS=1 tools/install-deps.sh
	cmake --build $(BUILD) -j $(JOBS) --target zarno_render_demon frame_painter $(subst demo-,,$@)_render
	DEMO_RENDERER=$(subst demo-,,$@) demo/run.sh $(BUILD)

install: build
	cmake --install $(BUILD) --prefix $(PREFIX)

format:
	clang-format -i $$(git ls-files '*.cpp' '*.h')

clean:
	rm -rf $(BUILD) $(BUILD)-asan $(BUILD)-fuzz
