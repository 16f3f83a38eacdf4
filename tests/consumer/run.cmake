# Installs the built library into a scratch prefix, then configures, builds and runs a
# consumer project against it.
file(REMOVE_RECURSE ${WORK_DIR})
set(prefix ${WORK_DIR}/prefix)

function(run)
    execute_process(COMMAND ${ARGN} RESULT_VARIABLE rc OUTPUT_VARIABLE out ERROR_VARIABLE err)
    if(NOT rc EQUAL 0)
        message(FATAL_ERROR "${ARGN} failed (${rc}):\n${out}\n${err}")
    endif()
    set(LAST_OUTPUT "${out}" PARENT_SCOPE)
endfunction()

run(${CMAKE_COMMAND} --install ${SILVAN_BUILD_DIR} --prefix ${prefix})
run(${CMAKE_COMMAND} -S ${CONSUMER_SOURCE_DIR} -B ${WORK_DIR}/build
    -DCMAKE_PREFIX_PATH=${prefix} -DCMAKE_BUILD_TYPE=Release)
run(${CMAKE_COMMAND} --build ${WORK_DIR}/build)
run(${WORK_DIR}/build/consumer ${SAMPLE} ${WORK_DIR}/scene.xml)
if(NOT LAST_OUTPUT MATCHES "scene_001.tif.*scene /data/block7/scene_003.tif 4.*generator made")
    message(FATAL_ERROR "unexpected consumer output:\n${LAST_OUTPUT}")
endif()
message(STATUS "consumer output:\n${LAST_OUTPUT}")
