# Front door: `make run` and `make test` install what is missing, build, then run.
BUILD_DIR ?= build
BUILD_TYPE ?= RelWithDebInfo
ARGS ?= -a
JOBS ?= $(shell nproc 2>/dev/null || echo 2)
PREFIX ?= /usr/local

.PHONY: all setup setup-tests programs build run test install sanitize fuzz clean

all: build

setup:
	@./scripts/setup.sh

setup-tests:
	@./scripts/setup.sh tests

# The programs alone: no test program, no GoogleTest.
programs: setup
	@cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) -DVESTAGE_TESTS=OFF >/dev/null
	@cmake --build $(BUILD_DIR) -j $(JOBS) --target vestage vestage-capture

# Everything, tests included, with warnings as errors.
build: setup-tests
	@cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) -DVESTAGE_TESTS=ON -DVESTAGE_WERROR=ON >/dev/null
	@cmake --build $(BUILD_DIR) -j $(JOBS)

run: programs
	./$(BUILD_DIR)/vestage $(ARGS)

test: build
	cd $(BUILD_DIR) && ctest --output-on-failure -j $(JOBS)

# The whole test suite under AddressSanitizer + UndefinedBehaviorSanitizer,
# then under ThreadSanitizer, each in a build directory of its own.
SANITIZE_FLAGS_address = -fsanitize=address,undefined -fno-sanitize-recover=all -fno-omit-frame-pointer
SANITIZE_FLAGS_thread = -fsanitize=thread
sanitize: setup-tests
	@for kind in address thread; do \
	    flags="$(SANITIZE_FLAGS_address)"; [ $$kind = thread ] && flags="$(SANITIZE_FLAGS_thread)"; \
	    cmake -S . -B $(BUILD_DIR)-$$kind -DCMAKE_BUILD_TYPE=Debug -DVESTAGE_TESTS=ON -DVESTAGE_WERROR=ON \
	        -DCMAKE_CXX_FLAGS="$$flags" -DCMAKE_EXE_LINKER_FLAGS="$$flags" >/dev/null && \
	    cmake --build $(BUILD_DIR)-$$kind -j $(JOBS) && \
	    (cd $(BUILD_DIR)-$$kind && ASAN_OPTIONS=detect_leaks=1 UBSAN_OPTIONS=print_stacktrace=1 \
	        TSAN_OPTIONS=halt_on_error=1 ctest --output-on-failure -j $(JOBS)) || exit 1; \
	done
	@$(MAKE) --no-print-directory fuzz FUZZ_SECONDS=10

# Every parser of untrusted input under libFuzzer (clang), FUZZ_SECONDS each,
# from the seeds in tests/fuzz/seeds and tests/data; what it learns stays in
# the build directory's corpora for the next run.
FUZZ_SECONDS ?= 60
FUZZ_SEEDS_heapfile = tests/data/heapfiles
FUZZ_SEEDS_smaps = tests/fuzz/seeds/smaps
FUZZ_SEEDS_proc = tests/fuzz/seeds/proc
FUZZ_SEEDS_kernel = tests/fuzz/seeds/kernel
FUZZ_SEEDS_elf = tests/fuzz/seeds/elf
fuzz: setup
	@command -v clang++ >/dev/null || { echo "make fuzz needs clang (apt-get install clang)" >&2; exit 1; }
	@cmake -S . -B $(BUILD_DIR)-fuzz -DCMAKE_CXX_COMPILER=clang++ -DCMAKE_BUILD_TYPE=RelWithDebInfo \
	    -DVESTAGE_TESTS=OFF -DVESTAGE_FUZZ=ON -DVESTAGE_WERROR=ON \
	    -DCMAKE_CXX_FLAGS="-fsanitize=fuzzer-no-link,address,undefined -fno-sanitize-recover=all" >/dev/null
	@cmake --build $(BUILD_DIR)-fuzz -j $(JOBS) --target fuzz_heapfile fuzz_smaps fuzz_proc fuzz_kernel fuzz_elf
	@for target in heapfile smaps proc kernel elf; do \
	    mkdir -p $(BUILD_DIR)-fuzz/corpus-$$target; \
	    seeds=$(FUZZ_SEEDS_heapfile); \
	    case $$target in smaps) seeds=$(FUZZ_SEEDS_smaps);; proc) seeds=$(FUZZ_SEEDS_proc);; \
	        kernel) seeds=$(FUZZ_SEEDS_kernel);; elf) seeds=$(FUZZ_SEEDS_elf);; esac; \
	    echo "fuzz_$$target: $(FUZZ_SECONDS) s"; \
	    $(BUILD_DIR)-fuzz/fuzz_$$target -max_total_time=$(FUZZ_SECONDS) -print_final_stats=1 \
	        $(BUILD_DIR)-fuzz/corpus-$$target $$seeds > $(BUILD_DIR)-fuzz/fuzz_$$target.log 2>&1; \
	    status=$$?; grep -E "^(stat::number_of_executed_units|stat::peak_rss_mb|==[0-9]+==ERROR|SUMMARY)" \
	        $(BUILD_DIR)-fuzz/fuzz_$$target.log; \
	    [ $$status -eq 0 ] || { echo "fuzz_$$target found a fault: $(BUILD_DIR)-fuzz/fuzz_$$target.log" >&2; exit 1; }; \
	done

install: programs
	cmake --install $(BUILD_DIR) --prefix $(PREFIX)

clean:
	rm -rf $(BUILD_DIR)
