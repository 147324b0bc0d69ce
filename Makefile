# Front door: `make run` and `make test` install what is missing, build, then run.
BUILD_DIR ?= build
BUILD_TYPE ?= RelWithDebInfo
ARGS ?= -a
JOBS ?= $(shell nproc 2>/dev/null || echo 2)

.PHONY: all setup build run test clean

all: build

setup:
	@./scripts/setup.sh

build: setup
	@cmake -S . -B $(BUILD_DIR) -DCMAKE_BUILD_TYPE=$(BUILD_TYPE) >/dev/null
	@cmake --build $(BUILD_DIR) -j $(JOBS)

run: build
	./$(BUILD_DIR)/vestage $(ARGS)

test: build
	cd $(BUILD_DIR) && ctest --output-on-failure -j $(JOBS)

clean:
	rm -rf $(BUILD_DIR)
