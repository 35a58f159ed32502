# The driver statistics tree (included from this directory's CMakeLists.txt).
target_sources(vireo_linux PRIVATE ${CMAKE_CURRENT_LIST_DIR}/stats_tree.cpp)

vireo_add_test(stats_tree_test ${CMAKE_CURRENT_LIST_DIR}/stats_tree_test.cpp LIBS vireo_linux)
