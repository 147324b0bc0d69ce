# Front door: `make run` and `make test` install what is missing, build, then run.
BUILD_DIR ?= build
BUILD_TYPE ?= RelWithDebInfo
ARGS ?= -a
JOBS ?= $(shell nproc 2>/dev/null || echo 2)
PREFIX ?= /usr/local

.PHONY: all setup setup-tests programs build run test install sanitize clean

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

install: programs
	cmake --install $(BUILD_DIR) --prefix $(PREFIX)

clean:
	rm -rf $(BUILD_DIR)
