// Symbol visibility of libzeparelayd: everything is hidden unless marked.
#ifndef ZEPARELAYD_EXPORT_H
#define ZEPARELAYD_EXPORT_H

#define ZEPARELAYD_API __attribute__((visibility("default")))

#endif
