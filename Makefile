# Thin wrapper over CMake.  `make test` configures, builds and runs every test;
# `make run` builds and runs the main job.
BUILD      ?= build
ASAN_BUILD ?= build-asan
M32_BUILD  ?= build-m32
JOBS       ?= $(shell nproc 2>/dev/null || echo 2)
CMAKE      ?= cmake

.PHONY: all build test run bench asan m32 clean

all: build

$(BUILD)/CMakeCache.txt:
	$(CMAKE) -S . -B $(BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: $(BUILD)/CMakeCache.txt
	$(CMAKE) --build $(BUILD) -j $(JOBS)

test: build
	cd $(BUILD) && ctest --output-on-failure -j $(JOBS)

# `make run`: the query tool with a name query over /usr, twice, on a cache
# under the build directory: the first run builds the cache, the second is
# served from it (see the --stats lines on standard error).
RUN_CACHE ?= $(BUILD)/run-cache
RUN_QUERY ?= --name 'stdio.h' /usr

run: build
	@rm -rf $(RUN_CACHE)
	@echo "== fsquery, first run: builds the cache"
	$(BUILD)/fsquery --cache $(RUN_CACHE) --stats $(RUN_QUERY)
	@echo "== fsquery, second run: served from the cache"
	$(BUILD)/fsquery --cache $(RUN_CACHE) --stats $(RUN_QUERY)

# `make bench`: fsquery against find, plocate and fd on a generated tree of
# BENCH_ENTRIES entries (default 200000): each job against its peer in
# alternated rounds (RUNS, default 7), ratios against their goals, peak memory.
# `BENCH_SIZES="50000 200000 800000" make bench`: the scaling table instead,
# nanoseconds per entry and peak memory per size.  Trees are generated once
# per size under $(BUILD)/bench-work (BENCH_WORK) and reused.
BENCH_ENTRIES ?= 200000
BENCH_SIZES   ?=
BENCH_WORK    ?= $(BUILD)/bench-work
# The build's messages go to standard error, so that standard output is the
# report alone and can be saved as it is.
bench: $(BUILD)/CMakeCache.txt
	@$(CMAKE) --build $(BUILD) -j $(JOBS) --target fsquery gen_tree resultsort_bench >&2
	@BUILD=$(BUILD) WORK=$(BENCH_WORK) BENCH_SIZES="$(BENCH_SIZES)" bench/fsquery_bench.sh $(BENCH_ENTRIES)

asan:
	$(CMAKE) -S . -B $(ASAN_BUILD) -DCMAKE_BUILD_TYPE=Debug -DFSCANNER_BUILD_BENCH=OFF \
	  -DCMAKE_CXX_FLAGS="-fsanitize=address,undefined -fno-omit-frame-pointer -fno-sanitize-recover=undefined" \
	  -DCMAKE_C_FLAGS="-fsanitize=address,undefined -fno-omit-frame-pointer" \
	  -DCMAKE_EXE_LINKER_FLAGS="-fsanitize=address,undefined" \
	  -DCMAKE_SHARED_LINKER_FLAGS="-fsanitize=address,undefined"
	$(CMAKE) --build $(ASAN_BUILD) -j $(JOBS)
	cd $(ASAN_BUILD) && ASAN_OPTIONS=detect_leaks=1 LSAN_OPTIONS=suppressions=$(CURDIR)/tests/lsan.supp \
	  UBSAN_OPTIONS=print_stacktrace=1 ctest --output-on-failure -j $(JOBS)

m32:
	$(CMAKE) -S . -B $(M32_BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DFSCANNER_BUILD_TESTS=OFF -DFSCANNER_BUILD_BENCH=OFF \
	  -DCMAKE_CXX_FLAGS=-m32 -DCMAKE_C_FLAGS=-m32 \
	  -DCMAKE_EXE_LINKER_FLAGS=-m32 -DCMAKE_SHARED_LINKER_FLAGS=-m32
	$(CMAKE) --build $(M32_BUILD) -j $(JOBS)
	file $(M32_BUILD)/libfscanner.so* | grep -q 'ELF 32-bit'

clean:
	rm -rf $(BUILD) $(ASAN_BUILD) $(M32_BUILD) $(TEST32_BUILD)

# Every fuzz/*.cpp as a libFuzzer program in $(FUZZ_BUILD); the library is
# compiled by clang with coverage and the address and undefined-behaviour
# checks, so a fault anywhere in a reader stops the run.
FUZZ_BUILD ?= build-fuzz
FUZZ_FLAGS ?= -fsanitize=fuzzer-no-link,address,undefined -fno-sanitize-recover=undefined -fno-omit-frame-pointer

.PHONY: fuzz
fuzz:
	CC=clang CXX=clang++ $(CMAKE) -S . -B $(FUZZ_BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DFSCANNER_BUILD_FUZZ=ON -DFSCANNER_BUILD_TESTS=OFF -DFSCANNER_BUILD_BENCH=OFF \
	  -DCMAKE_CXX_FLAGS="$(FUZZ_FLAGS)" -DCMAKE_C_FLAGS="$(FUZZ_FLAGS)"
	$(CMAKE) --build $(FUZZ_BUILD) --target fuzzers -j $(JOBS)

# `make test32`: the whole suite built for 32-bit Linux (-m32, GoogleTest
# compiled from source) and run by CTest under qemu-i386; the suites start
# the tool through the same emulator (FSCANNER_TEST_EMULATOR).
TEST32_BUILD ?= build-test32
# Cases labelled "slow" (the 200,000-record sorts: minutes under emulation)
# run in `make test` and `make asan`; here they are left out unless
# TEST32_CTEST_ARGS says otherwise.
TEST32_CTEST_ARGS ?= -LE slow
.PHONY: test32
test32:
	$(CMAKE) -S . -B $(TEST32_BUILD) -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	  -DCMAKE_TOOLCHAIN_FILE=$(CURDIR)/cmake/linux-i386.cmake \
	  -DFSCANNER_GTEST_FROM_SOURCE=ON -DFSCANNER_BUILD_BENCH=ON
	$(CMAKE) --build $(TEST32_BUILD) -j $(JOBS)
	file $(TEST32_BUILD)/libfscanner.so* $(TEST32_BUILD)/fsquery | grep -q 'ELF 32-bit'
	cd $(TEST32_BUILD) && ctest --output-on-failure -j $(JOBS) $(TEST32_CTEST_ARGS)

# `make install PREFIX=/some/where` (default /usr/local): library, headers,
# CMake package, pkg-config file, fsquery with its man page and completion.
# `make package`: Debian packages fscanner and fscanner-dev in $(BUILD).
PREFIX ?= /usr/local
.PHONY: install package
install: build
	$(CMAKE) --install $(BUILD) --prefix $(PREFIX)

package: build
	cd $(BUILD) && cpack -G DEB
	@ls -1 $(BUILD)/*.deb
