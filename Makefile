# Front door: `make run` and `make test` install what is missing, build, then run.
BUILD_DIR ?= build
BUILD_TYPE ?= RelWithDebInfo
ARGS ?= -a
JOBS ?= $(shell nproc 2>/dev/null || echo 2)
PREFIX ?= /usr/local

.PHONY: all setup setup-tests programs build run test install clean

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

install: programs
	cmake --install $(BUILD_DIR) --prefix $(PREFIX)

clean:
	rm -rf $(BUILD_DIR)
