# Short names for what CMake, CTest and the scripts do. Everything that is made lies in build*/.
SHELL := /bin/bash
.SHELLFLAGS := -euo pipefail -c
.DEFAULT_GOAL := build
# Targets share the folder build/: one after the other, however many jobs make is given.
.NOTPARALLEL:
.PHONY: build demo test package bench fuzz format check-format check-rooms clean

NEED := scripts/install-dependencies
SOURCES = find . -path './build*' -prune -o \( -name '*.h' -o -name '*.cpp' \) -print

build:
	@$(NEED) build
	@if [ -f build/CMakeCache.txt ]; then scripts/configure build; else scripts/configure build -DKEL_TESTS=OFF; fi
	@cmake --build build --target kel

demo: build
	@scripts/demo build/kel

test:
	@$(NEED) build test
	@scripts/configure build -DKEL_TESTS=ON
	@cmake --build build
	@ctest --test-dir build --output-on-failure --no-tests=error -j "$$(nproc)"

package: build
	@$(NEED) package
	@cmake --build build --target package

# BENCH_ARGS go to every program, for instance BENCH_ARGS=--benchmark_filter=Cold; BENCH_BUNDLES sets the
# size of the corpus.
BENCH_BUNDLES ?= 10000
bench:
	@$(NEED) build bench
	@scripts/configure build-bench -DCMAKE_BUILD_TYPE=Release -DKEL_TESTS=OFF -DKEL_BENCH=ON
	@cmake --build build-bench
	@scripts/bench build-bench $(BENCH_BUNDLES) $(BENCH_ARGS)

# Ten seconds for each target, or FUZZ_SECONDS.
FUZZ_SECONDS ?= 10
fuzz:
	@$(NEED) build ci
	@scripts/configure build-fuzz -DCMAKE_CXX_COMPILER=clang++ -DKEL_TESTS=OFF -DKEL_FUZZ=ON \
	  -DKEL_SANITIZE=address,undefined
	@cmake --build build-fuzz
	@scripts/fuzz build-fuzz $(FUZZ_SECONDS)

format:
	@$(NEED) ci
	@$(SOURCES) | xargs clang-format -i

check-format:
	@$(NEED) ci
	@$(SOURCES) | xargs clang-format --dry-run --Werror

check-rooms:
	@$(NEED) build test ci
	@scripts/check-rooms

clean:
	@rm -rf build build-*
