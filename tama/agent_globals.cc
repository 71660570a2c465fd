#include "tama/agent_globals.h"

char kq1_product_code[3] = {'Q', '7', '\0'};
char kq1_product_ver[10] = {};
char kq1_agent_name[256] = {};
char kq1_short_agent_name[256] = {};
char kq1_system_name[64] = {};
char KQ1_MsgFileName[kPathBufferSize] = {};

char KQ1_BaseDir[kPathBufferSize] = {};
char KTX_MordelDir[kPathBufferSize] = {};
char KQ1_ConfigPath[kPathBufferSize] = {};
char KQ1_DetailsPath[kPathBufferSize] = {};
char KQ1_CLASSPATH[kPathBufferSize] = {};
char RT_BundlePath[kPathBufferSize] = {};
