# The two commands a new user runs: `make run` and `make test`.
JOBS ?= $(shell nproc)
BUILD_DIR ?= build
# Where `make install` puts heft and its manual page; DESTDIR is prefixed to
# it for staged installs.
PREFIX ?= /usr/local
TEST_DIR ?= build-asan
TSAN_DIR ?= build-tsan
CLANG_DIR ?= build-clang
FUZZ_DIR ?= build-fuzz
# Seconds `make fuzz` runs for; empty for until it finds something or is
# stopped.
FUZZ_TIME ?=
# The tests that run threads of the gathering.
TSAN_TESTS ?= HTHeftGather*

.PHONY: all setup build install run test fuzz fuzz-build bench format lint clean

all: build

setup:
	@./scripts/setup.sh

build: setup
	cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF
	cmake --build $(BUILD_DIR) -j $(JOBS)

# Installs heft in $(PREFIX)/bin and its manual page in
# $(PREFIX)/share/man/man1.
install: build
	install -D -m 755 $(BUILD_DIR)/heft $(DESTDIR)$(PREFIX)/bin/heft
	install -D -m 644 docs/heft.1 $(DESTDIR)$(PREFIX)/share/man/man1/heft.1

# Builds heft and reports on every process of this machine.
run: build
	$(BUILD_DIR)/heft -a

# Builds everything with clang and runs the unit tests; runs the parallel
# gathering under ThreadSanitizer; then builds the whole suite with gcc under
# AddressSanitizer and UndefinedBehaviorSanitizer and runs it; last, fuzzes
# the snapfile reader for a minute. Warnings of either compiler are errors.
test: setup
	CC=clang CXX=clang++ cmake -S . -B $(CLANG_DIR) -DCMAKE_BUILD_TYPE=Release -DHEFT_WERROR=ON
	cmake --build $(CLANG_DIR) -j $(JOBS)
	cd $(CLANG_DIR) && ctest --output-on-failure -j $(JOBS) -LE e2e
	cmake -S . -B $(TSAN_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=thread -DHEFT_WERROR=ON
	cmake --build $(TSAN_DIR) -j $(JOBS) --target heft_tests
	$(TSAN_DIR)/tests/heft_tests --gtest_filter='$(TSAN_TESTS)'
	cmake -S . -B $(TEST_DIR) -DCMAKE_BUILD_TYPE=Debug -DHEFT_SANITIZE=address -DHEFT_WERROR=ON
	cmake --build $(TEST_DIR) -j $(JOBS)
	cd $(TEST_DIR) && ctest --output-on-failure -j $(JOBS)
	$(MAKE) fuzz FUZZ_TIME=60

# The snapfile fuzzer, built with clang (libFuzzer) under AddressSanitizer
# and UndefinedBehaviorSanitizer. It works on a corpus of its own in the
# build directory, seeded from tests/data/snapfiles/corpus and the reader
# tests' snapfiles, which it never writes to; what it finds goes to
# $(FUZZ_DIR)/findings, and it stops with a failure at the first finding.
fuzz-build: setup
	CC=clang CXX=clang++ cmake -S . -B $(FUZZ_DIR) -DCMAKE_BUILD_TYPE=RelWithDebInfo -DHEFT_BUILD_TESTS=OFF \
		-DHEFT_BUILD_FUZZ=ON -DHEFT_WERROR=ON
	cmake --build $(FUZZ_DIR) -j $(JOBS) --target heft_fuzz_snapfile
	mkdir -p $(FUZZ_DIR)/corpus $(FUZZ_DIR)/findings
	cp tests/data/snapfiles/*.heftsnap tests/data/snapfiles/corpus/* $(FUZZ_DIR)/corpus/

# Each input may take 10 seconds and the fuzzer 2 GB. The reader bounds
# what a snapfile may name, and the target leaves out the few snapfiles
# whose identified pages alone would take longer (see its source), so an
# input costs milliseconds and megabytes: one that comes near these bounds
# hangs or allocates without bound.
# -close_fd_mask=2 drops what heft itself says on standard error, thousands
# of lines a minute; libFuzzer's and the sanitizers' reports still show.
# Run the fuzzer on a finding's file to see all of it.
FUZZ_FLAGS = -rss_limit_mb=2048 -timeout=10 -close_fd_mask=2 -print_final_stats=1 \
	-artifact_prefix=$(FUZZ_DIR)/findings/
fuzz: fuzz-build
	$(FUZZ_DIR)/heft_fuzz_snapfile $(FUZZ_FLAGS) $(if $(FUZZ_TIME),-max_total_time=$(FUZZ_TIME)) $(FUZZ_DIR)/corpus

# Formats the sources in the house style (.clang-format).
format:
	find src tests bench -name '*.cpp' -o -name '*.h' -o -name '*.c' | xargs clang-format -i

# Checks the formatting and runs the checks of .clang-tidy.
lint: build
	find src tests bench -name '*.cpp' -o -name '*.h' -o -name '*.c' | xargs clang-format --dry-run --Werror
	run-clang-tidy -p $(BUILD_DIR) -quiet -j $(JOBS) '$(CURDIR)/src/'

bench: setup
	cmake -S . -B build-bench -DCMAKE_BUILD_TYPE=Release -DHEFT_BUILD_TESTS=OFF -DHEFT_BUILD_BENCH=ON
	cmake --build build-bench -j $(JOBS)
	build-bench/bench/heft_bench

clean:
	rm -rf $(BUILD_DIR) $(TEST_DIR) $(TSAN_DIR) $(CLANG_DIR) $(FUZZ_DIR) build-bench
