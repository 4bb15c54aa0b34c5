#include "data_blocks.h"

char primaryDataBlock[PRIMARY_DATA_BLOCK_SIZE];
int32_t outbufferleft = OUTBUFFER_BUDGET;
int32_t pdboverflow;
char topDataBlock[TOP_DATA_BLOCK_SIZE];
char topLogDataBlock[TOP_DATA_BLOCK_SIZE];
char lsDataBlock[LS_DATA_BLOCK_SIZE];
char newPSDataBlock[PS_DATA_BLOCK_SIZE];
char oldPSDataBlock[PS_DATA_BLOCK_SIZE];
char line[LINE_SIZE];
char words[WORD_COUNT][WORD_SIZE];
char file_buffer[FILE_BUFFER_SIZE];
