// The kit of fakes that the tests share; see the headers beside this file.
