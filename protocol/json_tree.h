/* A parsed or built JSON tree that is deleted with its owner. */
#ifndef PROTOCOL_JSON_TREE_H
#define PROTOCOL_JSON_TREE_H

#include <cjson/cJSON.h>
#include <memory>

struct json_deleter {
    void operator()(cJSON *tree) const { cJSON_Delete(tree); }
};

using json_tree = std::unique_ptr<cJSON, json_deleter>;

#endif
