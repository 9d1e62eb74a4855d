# Entry points for people and CI. Everything else is CMake.
BUILD      ?= build/release
ASAN_BUILD ?= build/asan
JOBS       ?= $(shell nproc)
# The release tests spend most of their time waiting on the real programs
# they start, so twice as many run at once as there are cores.
TEST_JOBS  ?= $(shell echo $$(( $(JOBS) * 2 )))
CMAKE_GEN  := -G Ninja

FUZZ_BUILD   ?= build/fuzz
FUZZ_SECONDS ?= 60
# Seconds per harness of the smoke run that `make test` includes.
FUZZ_SMOKE_SECONDS ?= 5

.PHONY: all deps build test test-release test-asan test-fuzz-smoke test-unit demo bench fuzz fuzz-build mutate clean format

all: build

deps:
	@./scripts/install-deps.sh

$(BUILD)/build.ninja: | deps
	cmake -S . -B $(BUILD) $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=RelWithDebInfo

build: deps $(BUILD)/build.ninja
	cmake --build $(BUILD) -j $(JOBS)

test-release: build
	ctest --test-dir $(BUILD) --output-on-failure -j $(TEST_JOBS)

$(ASAN_BUILD)/build.ninja: | deps
	cmake -S . -B $(ASAN_BUILD) $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Debug -DFBF_SANITIZE=ON

test-asan: deps $(ASAN_BUILD)/build.ninja
	cmake --build $(ASAN_BUILD) -j $(JOBS)
	ASAN_OPTIONS=detect_leaks=1:abort_on_error=1 UBSAN_OPTIONS=print_stacktrace=1:halt_on_error=1 \
	  ctest --test-dir $(ASAN_BUILD) --output-on-failure -j $(JOBS)

test: test-release test-asan test-fuzz-smoke test-unit

# The libFuzzer harnesses (tests/fuzz) in their own clang tree.
$(FUZZ_BUILD)/build.ninja: | deps
	CC=clang CXX=clang++ cmake -S . -B $(FUZZ_BUILD) $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=RelWithDebInfo -DFBF_FUZZ=ON

fuzz-build: deps $(FUZZ_BUILD)/build.ninja
	cmake --build $(FUZZ_BUILD) -j $(JOBS) --target fuzz_all

# Every harness for FUZZ_SECONDS, one after the other.
fuzz: fuzz-build
	./scripts/fuzz.sh $(FUZZ_BUILD) $(FUZZ_SECONDS)

test-fuzz-smoke: fuzz-build
	./scripts/fuzz.sh $(FUZZ_BUILD) $(FUZZ_SMOKE_SECONDS)

# The service unit: verified, and its exposure score within bounds.
test-unit: deps
	./scripts/check-unit.sh $(BUILD)/bin/vireon-fbf

# Plants MUTANTS small faults in src/ (from SEED) and counts how many the
# release tests catch; see scripts/mutate.py.
MUTANTS ?= 40
SEED    ?= 16
mutate: build
	./scripts/mutate.py --build $(BUILD) --seed $(SEED) --mutants $(MUTANTS)

demo: build
	./scripts/demo.sh $(BUILD)

bench: deps
	cmake -S . -B build/bench $(CMAKE_GEN) -DCMAKE_BUILD_TYPE=Release -DFBF_BUILD_BENCH=ON -DFBF_BUILD_TESTS=OFF
	cmake --build build/bench -j $(JOBS)
	./scripts/bench.sh build/bench

clean:
	rm -rf build

format:
	clang-format -i $$(git ls-files '*.cc' '*.h')
