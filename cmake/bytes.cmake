# cmake -DINPUT=FILE -DOUTPUT=FILE -P bytes.cmake: the bytes of a file as a list of C numbers, to be included.
file(READ ${INPUT} bytes HEX)
string(REGEX REPLACE "(..)" "0x\\1," bytes "${bytes}")
file(WRITE ${OUTPUT} "${bytes}\n")
