# The two commands of the README: `make run` and `make test`.
# Build folders: build/ (plain), build-asan/ (AddressSanitizer + UBSan),
# build-tsan/ (ThreadSanitizer, for the queue, transport and hold-list tests),
# build-fuzz/ (clang, libFuzzer targets of fuzz/ with ASan + UBSan).

JOBS ?= $(shell nproc)
CMAKE_FLAGS ?=
RUN_ARGS ?= -v
export ASAN_OPTIONS ?= detect_leaks=1:abort_on_error=1:strict_string_checks=1
export UBSAN_OPTIONS ?= print_stacktrace=1:halt_on_error=1
export TSAN_OPTIONS ?= halt_on_error=1:second_deadlock_stack=1

FUZZ_TARGETS := frame_decoder plist_reader json_reader rules_evaluator
FUZZ_SECONDS ?= 60

.PHONY: all deps build run test test-plain test-asan test-tsan bench install clean fuzz fuzz-build test-fuzz

all: build

deps:
	@scripts/install-deps

build/Makefile: CMakeLists.txt
	cmake -S . -B build $(CMAKE_FLAGS)

build: deps
	@cmake -S . -B build $(CMAKE_FLAGS) >/dev/null
	cmake --build build -j $(JOBS)

# Starts the daemon in the foreground on the bundled example applications,
# its log on standard error.
run: build
	scripts/run-examples $(RUN_ARGS)

test: build
	cd build && ctest --output-on-failure -j $(JOBS)
	$(MAKE) test-asan test-tsan test-fuzz

test-asan: deps
	@cmake -S . -B build-asan -DQM_SANITIZE=address $(CMAKE_FLAGS) >/dev/null
	cmake --build build-asan -j $(JOBS)
	cd build-asan && ctest --output-on-failure -j $(JOBS)

test-tsan: deps
	@cmake -S . -B build-tsan -DQM_SANITIZE=thread $(CMAKE_FLAGS) >/dev/null
	cmake --build build-tsan -j $(JOBS) --target concurrency_tests
	cd build-tsan && ctest --output-on-failure -j $(JOBS) -L 'queue|transport|hold_list'

bench: build
	build/bench/qmd_bench

fuzz-build: deps
	@cmake -S . -B build-fuzz -DQM_FUZZ=ON -DCMAKE_CXX_COMPILER=clang++ $(CMAKE_FLAGS) >/dev/null
	cmake --build build-fuzz -j $(JOBS) --target fuzz_targets

# Each target for FUZZ_SECONDS, growing its corpus in build-fuzz/fuzz-corpus.
fuzz: fuzz-build
	@for t in $(FUZZ_TARGETS); do \
	  echo "== $$t ($(FUZZ_SECONDS) s)"; \
	  fuzz/run-target $$t -max_total_time=$(FUZZ_SECONDS) || exit 1; \
	done

# Each target a few seconds from its seeds alone; any crash fails.
test-fuzz: fuzz-build
	@for t in $(FUZZ_TARGETS); do \
	  echo "== $$t"; \
	  fuzz/run-target --fresh $$t -max_total_time=5 >build-fuzz/test-fuzz-$$t.log 2>&1 \
	    || { tail -40 build-fuzz/test-fuzz-$$t.log; echo "test-fuzz: $$t failed"; exit 1; }; \
	  grep -E '^(stat::number_of_executed_units|#[0-9]+.*DONE)' build-fuzz/test-fuzz-$$t.log || true; \
	done

# Installs under $(PREFIX); DESTDIR, when set, stages the files there.
PREFIX ?= /usr/local
install: build
	DESTDIR="$(DESTDIR)" cmake --install build --prefix "$(PREFIX)"

clean:
	rm -rf build build-asan build-tsan build-fuzz
